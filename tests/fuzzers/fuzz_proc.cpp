// Reads arbitrary text as a PROC option.
#include <kestrel/exception.h>
#include <kestrel/processparams.h>

#include <string>
#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const std::string proc(reinterpret_cast<const char*>(data), size);
    ProcessStrategy strategy{};
    int first = 0, second = 0, third = 0;
    std::vector<int> list;
    try {
        GetProcessParameters(proc, strategy, first, second, third, list);
    } catch (const kestrel::DataException&) {
    }
    return 0;
}
