// Reads arbitrary bytes as a scene description file.
#include <kestrel/exception.h>
#include <silvan/tosceneparser.h>

#include "fuzz_input.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const std::string path = FuzzInputFile(data, size, "scene.xml");
    try {
        kestrel::processes::silvan::TOSceneParser scene(path.c_str());
    } catch (const kestrel::Exception&) {
    }
    return 0;
}
