// Reads arbitrary bytes as a parameter file and asks for every value in every type.
#include <kestrel/exception.h>
#include <kestrel/mfileparser.h>

#include <memory>

#include "fuzz_input.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const std::string path = FuzzInputFile(data, size, "mfile.txt");
    kestrel::MFileParser reader(0);
    std::unique_ptr<kestrel::ParametersTableIF> table(reader.Create(path));
    if (!table)
        return 0;
    table->AddDefaultString("x");
    table->AddDefaultInt(3);
    table->AddDefaultIntList({1, 2});
    const int lines = static_cast<int>(table->GetLineCount());
    for (int line = 0; line < lines && line < 64; ++line) {
        for (int column = 0; column < 5; ++column) {
            try {
                table->GetString(line, column);
            } catch (const kestrel::DataException&) {
            }
            try {
                table->GetInt(line, column);
            } catch (const kestrel::DataException&) {
            }
            try {
                table->GetIntList(line, column);
            } catch (const kestrel::DataException&) {
            }
        }
    }
    return 0;
}
