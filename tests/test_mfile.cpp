// The parameter-table reader: grammar, defaults, typed reading and its errors.
#include <kestrel/mfileparser.h>

#include "support.h"

#include <filesystem>
#include <memory>
#include <thread>

#if !defined(_WIN32)
#include <sys/stat.h>
#endif

using kestrel::DataException;
using kestrel::MFileParser;
using kestrel::ParametersTableIF;
using testsupport::Contains;
using testsupport::TempDir;
using testsupport::Thrown;
using testsupport::WriteFile;

namespace {

std::unique_ptr<ParametersTableIF> Read(const std::string& path) {
    MFileParser reader(0);
    return std::unique_ptr<ParametersTableIF>(reader.Create(path));
}

}  // namespace

// LF, CR LF and a lone CR each end a line; header, comment and blank lines are no data lines;
// no line end stays in a value, and line numbers in messages count every kind of line end.
TEST(MFileTable, LineEndsHeadersCommentsAndBlankLines) {
    TempDir dir;
    const char* const files[] = {
        "!MFILE header\r\n a;1\r\n\r\n   \t\n!comment;9\nb;2\nc;x",
        "!MFILE header\ra;1\r\r\n!comment;9\rb;2\r\r\nc;x\r",
        "!MFILE header\n\na;1\r\n!comment;9\r\n\rb;2\nc;x\n",
    };
    for (const char* bytes : files) {
        auto table = Read(WriteFile(dir.File("m.txt"), bytes));
        ASSERT_TRUE(table);
        ASSERT_EQ(table->GetLineCount(), 3u) << bytes;
        EXPECT_EQ(table->GetString(0, 0), "a");
        EXPECT_EQ(table->GetInt(0, 1), 1);
        EXPECT_EQ(table->GetString(1, 1), "2") << bytes;
        EXPECT_EQ(table->GetString(2, 1), "x") << bytes;
        const auto e = Thrown<DataException>([&] { table->GetInt(2, 1); }, bytes);
        EXPECT_TRUE(e && Contains(e->GetErrorMessage(), ", line 7, column 1")) << bytes;
    }
}

// A control byte in a value would be cut off or misread by whoever uses it: refused with the
// file, line, column and the byte's place. Tab passes.
TEST(MFileTable, ControlBytesInValuesAreRefused) {
    TempDir dir;
    const char bytes[] = "a\tb;x\x01y;ok\n!h\nn\0ul;\x7F;\x1B\n";
    const std::string path = WriteFile(dir.File("m.txt"), std::string(bytes, sizeof bytes - 1));
    auto table = Read(path);
    EXPECT_EQ(table->GetString(0, 0), "a\tb");
    EXPECT_EQ(table->GetString(0, 2), "ok");
    const struct {
        int line, column;
        const char* where;
    } cases[] = {
        {0, 1, ", line 1, column 1: the value holds the control byte 0x01 at character 6"},
        {1, 0,
         ", line 3, column 0: the value holds the control byte 0x00 at character 2 of the line; "
         "only tab is allowed (a binary file, such as an image, is no parameter file)"},
        {1, 1, ", line 3, column 1: the value holds the control byte 0x7F at character 6"},
        {1, 2, ", line 3, column 2: the value holds the control byte 0x1B at character 8"}};
    for (const auto& c : cases) {
        if (const auto e =
                Thrown<DataException>([&] { table->GetString(c.line, c.column); }, c.where)) {
            EXPECT_EQ(e->GetErrorMessage().rfind(path + c.where, 0), 0u) << e->GetErrorMessage();
            // Only a NUL says that the file is binary.
            EXPECT_EQ(Contains(e->GetErrorMessage(), "binary"), Contains(c.where, "0x00"));
        }
    }
}

// Fields are trimmed but keep inner blanks, list items may have blanks around them, later
// columns do not shift earlier ones, and a file of comments and blank lines has no lines.
TEST(MFileTable, FieldsAndListsReadAsWritten) {
    TempDir dir;
    auto table =
        Read(WriteFile(dir.File("m.txt"),
                       " \tmy scene.tif\t ; -12 ;1,2,3; 4 , -5 ,+6 ;2147483647,-2147483648;e\n"));
    EXPECT_EQ(table->GetString(0, 0), "my scene.tif");
    EXPECT_EQ(table->GetInt(0, 1), -12);
    EXPECT_EQ(table->GetIntList(0, 2), (std::vector<int>{1, 2, 3}));
    EXPECT_EQ(table->GetIntList(0, 3), (std::vector<int>{4, -5, 6}));
    EXPECT_EQ(table->GetIntList(0, 4), (std::vector<int>{2147483647, -2147483648}));
    EXPECT_EQ(table->GetString(0, 5), "e");
    EXPECT_EQ(Read(WriteFile(dir.File("c.txt"), "!MFILE\n\n  \n"))->GetLineCount(), 0u);
    EXPECT_EQ(Read(WriteFile(dir.File("e.txt"), ""))->GetLineCount(), 0u);
}

TEST(MFileTable, MissingOrEmptyFieldsReadAsTypedDefaultsOrAreRefusedWithout) {
    TempDir dir;
    auto table = Read(WriteFile(dir.File("m.txt"), "only\na;;\n"));
    table->AddDefaultString("name");
    table->AddDefaultInt(-5);
    table->AddDefaultIntList({3, -1, 7});
    for (int line = 0; line < 2; ++line) {
        EXPECT_EQ(table->GetInt(line, 1), -5);
        EXPECT_EQ(table->GetIntList(line, 2), (std::vector<int>{3, -1, 7}));
        EXPECT_EQ(table->GetString(line, 2), "3,-1,7");
    }
    EXPECT_EQ(table->GetString(0, 0), "only");
    table->AddDefaultIntList({});
    EXPECT_TRUE(table->GetIntList(0, 3).empty());

    // No silent 0 or empty text: a value that is missing without a default, or empty with a
    // text default, is refused like a bad one.
    auto bare = Read(WriteFile(dir.File("bare.txt"), "a;\n"));
    EXPECT_THROW(bare->GetString(0, 1), DataException);
    bare->AddDefaultString("");
    bare->AddDefaultString("");
    EXPECT_THROW(bare->GetInt(0, 1), DataException);
    EXPECT_THROW(bare->GetString(0, 2), DataException);
    EXPECT_THROW(bare->GetString(1, 0), DataException);
    EXPECT_THROW(bare->GetString(0, -1), DataException);
}

// A value that is not of the asked type is refused with the file, line in the file and column.
TEST(MFileTable, BadValuesNameFileLineAndColumn) {
    TempDir dir;
    const std::string path = WriteFile(
        dir.File("bad.txt"), "!header\nok;1;1,2\n\nabc;x1;1,,2;99999999999;7,z;+-5;1,+-2\n");
    auto table = Read(path);
    table->AddDefaultString("");
    table->AddDefaultString("");
    const struct {
        int column;
        bool list;
        const char* value;
    } cases[] = {{0, false, "\"abc\" is not an integer"},
                 {1, false, "\"x1\" is not an integer"},
                 {2, true, "\"\" is not an integer"},
                 {3, false, "\"99999999999\" is out of the 32-bit integer range"},
                 {4, true, "\"z\" is not an integer"},
                 {5, false, "\"+-5\" is not an integer"},
                 {6, true, "\"+-2\" is not an integer"}};
    for (const auto& c : cases) {
        if (const auto e = Thrown<DataException>(
                [&] {
                    c.list ? (void)table->GetIntList(1, c.column)
                           : (void)table->GetInt(1, c.column);
                },
                c.value)) {
            EXPECT_EQ(e->GetErrorMessage(),
                      path + ", line 4, column " + std::to_string(c.column) + ": " + c.value);
            EXPECT_TRUE(Contains(e->GetFunction(), "GetInt"));
        }
    }
}

TEST(MFileTable, UnreadableFilesGiveNoTableAndTooLargeOnesAreRefused) {
    TempDir dir;
    EXPECT_FALSE(Read(dir.File("missing.txt")));
    EXPECT_FALSE(Read(dir.Path().string()));
    const std::string large = WriteFile(dir.File("large.txt"), "a;1\n");
    std::filesystem::resize_file(large, MFileParser::kMaxFileBytes + 1);  // sparse: no disk used
    const auto e = Thrown<kestrel::FileAccessException>([&] { Read(large); });
    EXPECT_TRUE(e && e->GetFileName() == large &&
                Contains(e->GetErrorMessage(), "larger than 256 MiB"));
}

#if !defined(_WIN32)
// A pipe (as a shell's <(...) gives) is read to its end like a file.
TEST(MFileTable, PipeIsRead) {
    TempDir dir;
    const std::string fifo = dir.File("fifo");
    ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
    std::thread writer([&fifo] { WriteFile(fifo, "!header\na;1\nb;2\n"); });
    auto table = Read(fifo);
    if (!table)
        std::ifstream release(fifo);  // lets the writer finish
    writer.join();
    ASSERT_TRUE(table);
    EXPECT_EQ(table->GetLineCount(), 2u);
    EXPECT_EQ(table->GetInt(1, 1), 2);
}
#endif

// A file of many read chunks: lines, comments, blank lines and CR LF ends that straddle chunk
// boundaries are indexed like any others.
TEST(MFileTable, LargeFileIsIndexedAcrossReadChunks) {
    TempDir dir;
    std::string bytes = "\xEF\xBB\xBF!header\r\n";
    std::vector<std::string> names;
    for (int i = 0; i < 30000; ++i) {
        names.push_back("scene_" + std::to_string(i) + std::string(i % 61, 'x'));
        bytes += names.back() + ";" + std::to_string(i) + (i % 3 ? "\r\n" : "\n");
        if (i % 97 == 0)
            bytes += "! comment " + std::to_string(i) + "\n";
        if (i % 89 == 0)
            bytes += " \t \r\n";
    }
    bytes += "last;-1";
    auto table = Read(WriteFile(dir.File("large.txt"), bytes));
    ASSERT_EQ(table->GetLineCount(), names.size() + 1);
    for (int i = 0; i < static_cast<int>(names.size()); ++i) {
        ASSERT_EQ(table->GetString(i, 0), names[static_cast<std::size_t>(i)]);
        ASSERT_EQ(table->GetInt(i, 1), i);
    }
    EXPECT_EQ(table->GetString(30000, 0), "last");
    EXPECT_EQ(table->GetInt(30000, 1), -1);
}
