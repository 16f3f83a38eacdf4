#include <silvan/toppfbase.h>

#include <memory>
#include <vector>

namespace kestrel {
namespace processes {
namespace silvan {

TOPPFBase::TOPPFBase()
    : cancelFlag(false), processValue1(0), processValue2(1), processValue3(-1), processValue4(-1) {}

TOPPFBase::TOPPFBase(const TOPPFBase&) = default;
TOPPFBase& TOPPFBase::operator=(const TOPPFBase&) = default;
TOPPFBase::~TOPPFBase() = default;

void TOPPFBase::SetProc(const std::string& text) {
    proc = text;
}

bool* TOPPFBase::GetCancelFlag() {
    return &cancelFlag;
}

void TOPPFBase::SetCancelFlag(bool cancel) {
    cancelFlag = cancel;
}

ITrueOrtho* TOPPFBase::CreateTrueortho(GeneratorType type) {
    // GetProcessParameters sets every output; they start defined all the same, so that a reader
    // that leaves one alone cannot make this read an indeterminate value.
    ProcessStrategy strategy = PROCESS_STRATEGY_AUTO;
    int first = 0;
    int second = 0;
    int third = 0;
    std::vector<int> list;
    GetProcessParameters(proc, strategy, first, second, third, list);

    const auto threads = static_cast<unsigned int>(first);
    std::unique_ptr<ITrueOrtho> generator;
    switch (strategy) {
        case PROCESS_STRATEGY_AUTO:
            generator.reset(TrueOrthoFactory::CreateGenerator(type, threads));
            break;
        case PROCESS_STRATEGY_CPU:
            generator.reset(TrueOrthoFactory::CreateCPUGenerator(type, threads));
            break;
        case PROCESS_STRATEGY_GPU:
            if (!list.empty()) {
                generator.reset(TrueOrthoFactory::CreateCudaGenerator(
                    type, list, threads, static_cast<unsigned int>(second)));
            } else {
                generator.reset(TrueOrthoFactory::CreateCudaGenerator(
                    type, threads, static_cast<unsigned int>(third),
                    static_cast<unsigned int>(second)));
            }
            // No usable graphics processor: run on the central processor instead.
            if (!generator)
                generator.reset(TrueOrthoFactory::CreateCPUGenerator(type, threads));
            break;
        default:
            generator.reset(TrueOrthoFactory::CreateGenerator(type, 0));
            break;
    }
    if (!generator) {
        KESTREL_THROW(DataException,
                      FormatString("Failed to instantiate an trueortho generator with PROC option "
                                   "set to \"%s\"",
                                   proc.c_str()));
    }
    return generator.release();
}

TorthoGenerator* TOPPFBase::CreateTorthoGenerator() {
    // Held until its kind is known, so that a generator of the wrong kind is released.
    std::unique_ptr<ITrueOrtho> generator(CreateTrueortho(GENERATOR_TORTHO));
    if (dynamic_cast<TorthoGenerator*>(generator.get()) == nullptr) {
        KESTREL_THROW(DataException, "The trueortho generator is not of the expected type");
    }
    return static_cast<TorthoGenerator*>(generator.release());
}

OcclusionRecovery* TOPPFBase::CreateOcclusionRecovery() {
    std::unique_ptr<ITrueOrtho> generator(CreateTrueortho(GENERATOR_OCCLUSION_RECOVERY));
    if (dynamic_cast<OcclusionRecovery*>(generator.get()) == nullptr) {
        KESTREL_THROW(DataException, "The trueortho generator is not of the expected type");
    }
    return static_cast<OcclusionRecovery*>(generator.release());
}

}  // namespace silvan
}  // namespace processes
}  // namespace kestrel
