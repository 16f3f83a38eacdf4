// Reads arbitrary bytes as a scene description file; a scene that reads is written and read
// back, and must give the same names, segment and footprint.
#include <kestrel/exception.h>
#include <silvan/tosceneparser.h>

#include <cstring>
#include <memory>

#include "fuzz_input.h"

using kestrel::processes::silvan::TOSceneParser;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const FuzzDir& dir = FuzzDir::Get();
    const std::string path = dir.Write("scene.xml", data, size);
    std::unique_ptr<TOSceneParser> scene;
    try {
        scene = std::make_unique<TOSceneParser>(path.c_str());
    } catch (const kestrel::Exception&) {
        return 0;
    }
    const std::string out = dir.Path("written.xml");
    scene->SetXMLFilename(out);
    try {
        scene->Serialize(false);
    } catch (const kestrel::DataException&) {
        return 0;  // a name that XML cannot hold is refused
    }
    TOSceneParser back(out.c_str());
    FUZZ_EXPECT(back.GetSceneFilename() == scene->GetSceneFilename());
    FUZZ_EXPECT(back.GetOrthoFilename() == scene->GetOrthoFilename());
    FUZZ_EXPECT(back.GetVisIdxFilename() == scene->GetVisIdxFilename());
    FUZZ_EXPECT(back.GetElevMapFilename() == scene->GetElevMapFilename());
    FUZZ_EXPECT(back.GetMmseg() == (scene->GetMmseg() > 0 ? scene->GetMmseg() : -1));
    const auto* a = scene->GetSceneFootprint();
    const auto* b = back.GetSceneFootprint();
    FUZZ_EXPECT(a != nullptr && b != nullptr && a->numPoints == b->numPoints);
    FUZZ_EXPECT(std::memcmp(a->points, b->points, a->numPoints * sizeof a->points[0]) == 0);
    return 0;
}
