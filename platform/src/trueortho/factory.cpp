#include <kestrel/trueortho.h>

#include <kestrel/exception.h>

#include "../factoryslot.h"

#include <algorithm>
#include <thread>
#include <utility>

namespace kestrel {
namespace processes {

ITrueOrtho::ITrueOrtho(GeneratorSettings settings) : settings_(std::move(settings)) {}
ITrueOrtho::~ITrueOrtho() = default;

unsigned int ITrueOrtho::ThreadsToUse() const {
    if (settings_.threadCount > 0)
        return settings_.threadCount;
    return std::max(1u, std::thread::hardware_concurrency());
}

TorthoGenerator::TorthoGenerator(GeneratorSettings settings) : ITrueOrtho(std::move(settings)) {}
TorthoGenerator::~TorthoGenerator() = default;

OcclusionRecovery::OcclusionRecovery(GeneratorSettings settings)
    : ITrueOrtho(std::move(settings)) {}
OcclusionRecovery::~OcclusionRecovery() = default;

TrueOrthoFactoryImpl::~TrueOrthoFactoryImpl() = default;

namespace {

void CheckType(GeneratorType type, const SourceLocation& where) {
    if (type != GENERATOR_TORTHO && type != GENERATOR_OCCLUSION_RECOVERY) {
        KESTREL_THROW_AT(where, DataException,
                         FormatString("Unknown true-ortho generator type %d: expected 0 "
                                      "(TorthoGenerator) or 1 (OcclusionRecovery)",
                                      static_cast<int>(type)));
    }
}

ITrueOrtho* MakeGenerator(GeneratorType type, GeneratorSettings settings) {
    if (type == GENERATOR_TORTHO)
        return new TorthoGenerator(std::move(settings));
    return new OcclusionRecovery(std::move(settings));
}

// This build carries no graphics-processor code, so no graphics processor is ever usable and
// every request for one is answered with null, leaving the choice of fallback to the caller.
class BuiltInFactory final : public TrueOrthoFactoryImpl {
  public:
    ITrueOrtho* CreateGenerator(GeneratorType type, unsigned int threadCount) override {
        CheckType(type, KESTREL_HERE);
        return CreateCPUGenerator(type, threadCount);
    }

    ITrueOrtho* CreateCPUGenerator(GeneratorType type, unsigned int threadCount) override {
        CheckType(type, KESTREL_HERE);
        GeneratorSettings settings;
        settings.processor = ProcessorKind::Central;
        settings.threadCount = threadCount;
        return MakeGenerator(type, std::move(settings));
    }

    ITrueOrtho* CreateCudaGenerator(GeneratorType type, const std::vector<int>&, unsigned int,
                                    unsigned int) override {
        CheckType(type, KESTREL_HERE);
        return nullptr;
    }

    ITrueOrtho* CreateCudaGenerator(GeneratorType type, unsigned int, unsigned int,
                                    unsigned int) override {
        CheckType(type, KESTREL_HERE);
        return nullptr;
    }
};

FactorySlot<TrueOrthoFactoryImpl>& Slot() {
    static FactorySlot<TrueOrthoFactoryImpl> slot(std::make_shared<BuiltInFactory>());
    return slot;
}

std::shared_ptr<TrueOrthoFactoryImpl> Current() {
    return Slot().Current();
}

}  // namespace

ITrueOrtho* TrueOrthoFactory::CreateGenerator(GeneratorType type, unsigned int threadCount) {
    return Current()->CreateGenerator(type, threadCount);
}

ITrueOrtho* TrueOrthoFactory::CreateCPUGenerator(GeneratorType type, unsigned int threadCount) {
    return Current()->CreateCPUGenerator(type, threadCount);
}

ITrueOrtho* TrueOrthoFactory::CreateCudaGenerator(GeneratorType type,
                                                  const std::vector<int>& devices,
                                                  unsigned int threadCount,
                                                  unsigned int streamCount) {
    return Current()->CreateCudaGenerator(type, devices, threadCount, streamCount);
}

ITrueOrtho* TrueOrthoFactory::CreateCudaGenerator(GeneratorType type, unsigned int threadCount,
                                                  unsigned int deviceCount,
                                                  unsigned int streamCount) {
    return Current()->CreateCudaGenerator(type, threadCount, deviceCount, streamCount);
}

std::shared_ptr<TrueOrthoFactoryImpl> TrueOrthoFactory::GetDefaultImplementation() {
    return Slot().BuiltIn();
}

std::shared_ptr<TrueOrthoFactoryImpl> TrueOrthoFactory::SetImplementation(
    std::shared_ptr<TrueOrthoFactoryImpl> impl) {
    return Slot().Install(std::move(impl));
}

ScopedTrueOrthoFactoryImpl::ScopedTrueOrthoFactoryImpl(std::shared_ptr<TrueOrthoFactoryImpl> impl)
    : previous_(TrueOrthoFactory::SetImplementation(std::move(impl))) {}

ScopedTrueOrthoFactoryImpl::~ScopedTrueOrthoFactoryImpl() {
    TrueOrthoFactory::SetImplementation(std::move(previous_));
}

}  // namespace processes
}  // namespace kestrel
