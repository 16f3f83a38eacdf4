// Reads a file list through the installed library and prints its lines.
#include <silvan/silvan.h>

#include <iostream>

int main(int argc, char** argv) {
    if (argc != 2) return 2;
    try {
        kestrel::processes::silvan::FileListParser files(argv[1]);
        for (unsigned int i = 0; i < files.GetMfileLines(); ++i) {
            files.ParseLine(static_cast<int>(i));
            std::cout << files.GetFili() << '\n';
        }
    } catch (const kestrel::Exception& e) {
        std::cerr << e.Describe() << '\n';
        return 1;
    }
    return 0;
}
