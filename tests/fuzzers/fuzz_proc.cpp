// Reads arbitrary text as a PROC option and makes both kinds of generator from it, as a
// process does through its base class.
#include <kestrel/exception.h>
#include <silvan/toppfbase.h>

#include <memory>
#include <string>

#include "fuzz_input.h"

namespace {

class Process : public kestrel::processes::silvan::TOPPFBase {
  public:
    void Execute() override {}
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    Process process;
    process.SetProc(std::string(reinterpret_cast<const char*>(data), size));
    try {
        std::unique_ptr<kestrel::processes::TorthoGenerator> generator(
            process.CreateTorthoGenerator());
        FUZZ_EXPECT(generator != nullptr);
    } catch (const kestrel::DataException&) {
    }
    try {
        std::unique_ptr<kestrel::processes::OcclusionRecovery> generator(
            process.CreateOcclusionRecovery());
        FUZZ_EXPECT(generator != nullptr);
    } catch (const kestrel::DataException&) {
    }
    return 0;
}
