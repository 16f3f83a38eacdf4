// Prints the file names of a file list, one per line.
#include "message.h"

#include <silvan/silvan.h>

#include <iostream>

int main(int argc, char** argv) {
    if (argc != 2) {
        std::cerr << "usage: silvan-filelist FILE_LIST\n";
        return 2;
    }
    try {
        kestrel::processes::silvan::FileListParser files(argv[1]);
        for (unsigned int i = 0; i < files.GetMfileLines(); ++i) {
            files.ParseLine(static_cast<int>(i));
            std::cout << files.GetFili() << '\n';
        }
    } catch (const kestrel::Exception& e) {
        std::cerr << "silvan-filelist: " << tools::UserMessage(e) << '\n';
        return 1;
    }
    return 0;
}
