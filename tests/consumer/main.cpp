// Uses the installed library as a process would: reads a file list, writes and reads back a
// scene description, and creates a generator through a process class of its own.
#include <silvan/silvan.h>

#include <iostream>
#include <memory>

namespace silvan = kestrel::processes::silvan;

namespace {

class Process : public silvan::TOPPFBase {
public:
    void Execute() override {}
};

}  // namespace

int main(int argc, char** argv) {
    if (argc != 3) return 2;
    try {
        silvan::FileListParser files(argv[1]);
        for (unsigned int i = 0; i < files.GetMfileLines(); ++i) {
            files.ParseLine(static_cast<int>(i));
            std::cout << files.GetFili() << '\n';
        }

        std::unique_ptr<silvan::TOSceneParser> scene(
            silvan::ParserFactory::CreateSceneParser(argv[2]));
        scene->SetSceneFilename(files.GetFili());
        auto* points = new point2_t<double>[4]{{0, 0}, {1, 0}, {1, 1}, {0, 1}};
        const kestrel::tin::Polygon<double> footprint(points, 4);
        scene->SetSceneFootprint(&footprint);
        scene->Serialize(false);
        std::unique_ptr<silvan::TOSceneParser> again(
            silvan::ParserFactory::CreateSceneParser(argv[2]));
        std::cout << "scene " << again->GetSceneFilename() << ' '
                  << again->GetSceneFootprint()->numPoints << '\n';

        Process process;
        process.SetProc("CPU:2");
        std::unique_ptr<kestrel::processes::TorthoGenerator> generator(
            process.CreateTorthoGenerator());
        std::cout << "generator made\n";
    } catch (const kestrel::Exception& e) {
        std::cerr << e.Describe() << '\n';
        return 1;
    }
    return 0;
}
