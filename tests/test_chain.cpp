// The workflow's file chain through files on disk: a master file, the two files derived from
// it, and those read back through the parser factory with typed values.
#include <silvan/parserfactory.h>

#include "support.h"

#include <kestrel/file.h>
#include <kestrel/processparams.h>

#include <cerrno>
#include <clocale>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>

#if defined(__linux__)
#include <sys/mount.h>
#endif

using kestrel::DataException;
using kestrel::FileAccessException;
using kestrel::ParameterException;
using kestrel::processes::silvan::FileListParser;
using kestrel::processes::silvan::ParserFactory;
using kestrel::processes::silvan::TOImgSetParser;
using kestrel::processes::silvan::TOMFileParser;
using kestrel::processes::silvan::TOSceneParser;
using kestrel::processes::silvan::TPMFileParser;
using kestrel::tin::Polygon;
using testsupport::TempDir;
using testsupport::WriteFile;

namespace {

struct Chain {
    TempDir dir;
    std::string master = WriteFile(dir.File("master.txt"),
                                   "!MFILE true-ortho master\n"
                                   "/data/a.tif;1,2,3;7;0,16;0;5;low;2;fill\n"
                                   "D:\\data\\b.tif;4;3;;255;;High;1;prep\n"
                                   "c.tif;;;1;;1;moderate;;\n");
    std::string prep = dir.File("prep.txt");
    std::string imgset = dir.File("imgset.txt");

    Chain() {
        std::unique_ptr<TOMFileParser> parser(ParserFactory::CreateTOMFileParser(master));
        parser->WriteMFilePrep(prep);
        parser->WriteImgSet(imgset);
    }
};

}  // namespace

// The preparation file reads back typed, with the process's defaults for empty columns; the
// image-set file without the preparation lines, with the default pixel error.
TEST(FileChain, DerivedFilesReadBackTypedWithDefaultsForEmptyColumns) {
    Chain chain;
    std::vector<unsigned int> dbic{9};
    std::vector<int> dbiw{-1, 8};
    std::unique_ptr<TPMFileParser> prep(
        ParserFactory::CreateTPMFileParser(chain.prep, dbic, 11, dbiw, "-32768", 4));
    ASSERT_EQ(prep->GetMfileLines(), 3u);
    const struct {
        const char* fili;
        std::vector<unsigned int> dbic;
        int mmseg;
        std::vector<int> dbiw;
        const char* srcBgd;
        int edgeClip;
    } lines[] = {{"/data/a.tif", {1, 2, 3}, 7, {0, 16}, "0", 5},
                 {"D:\\data\\b.tif", {4}, 3, {-1, 8}, "255", 4},
                 {"c.tif", {9}, 11, {1}, "-32768", 1}};
    for (int i = 0; i < 3; ++i) {
        prep->ParseLine(i);
        EXPECT_EQ(prep->GetFili(), lines[i].fili);
        EXPECT_EQ(prep->GetDbic(), lines[i].dbic);
        EXPECT_EQ(prep->GetMmseg(), lines[i].mmseg);
        EXPECT_EQ(prep->GetDbiw(), lines[i].dbiw);
        EXPECT_EQ(prep->GetSrcBgd(), lines[i].srcBgd);
        EXPECT_EQ(prep->GetEdgeClip(), lines[i].edgeClip);
    }
    std::unique_ptr<TOImgSetParser> imgset(
        ParserFactory::CreateImgSetParser(chain.imgset, RadioDifHigh, 5));
    ASSERT_EQ(imgset->GetMfileLines(), 2u);
    imgset->ParseLine(0);
    EXPECT_EQ(imgset->GetSceneId(), "a.tif");
    EXPECT_EQ(imgset->GetRadioDif(), RadioDifLow);
    EXPECT_EQ(imgset->GetDbmPxErr(), 2);
    imgset->ParseLine(1);
    EXPECT_EQ(imgset->GetSceneId(), "c.tif");
    EXPECT_EQ(imgset->GetRadioDif(), RadioDifModerate);
    EXPECT_EQ(imgset->GetDbmPxErr(), 5);
    EXPECT_THROW(imgset->ParseLine(2), DataException);
}

// Numbers and keywords are read as they are written, whatever locale the process has set: with
// a decimal comma (de_DE) or a dotless capital I (tr_TR), nothing reads differently.
TEST(FileChain, EverythingReadsTheSameUnderAnyLocale) {
    int tried = 0;
    for (const char* name : {"de_DE.UTF-8", "tr_TR.UTF-8"}) {
        if (std::setlocale(LC_ALL, name) == nullptr)
            continue;  // tools/install-deps.sh generates both
        ++tried;
        struct Restore {
            ~Restore() { std::setlocale(LC_ALL, "C"); }
        } restore;
        Chain chain;
        std::unique_ptr<TOImgSetParser> imgset(
            ParserFactory::CreateImgSetParser(chain.imgset, RadioDifAny, 5));
        imgset->ParseLine(0);
        EXPECT_EQ(imgset->GetRadioDif(), RadioDifLow);
        const std::string high = WriteFile(chain.dir.File("high.txt"), "a;high;1\n");
        std::unique_ptr<TOImgSetParser> highSet(
            ParserFactory::CreateImgSetParser(high, RadioDifAny, 5));
        highSet->ParseLine(0);
        EXPECT_EQ(highSet->GetRadioDif(), RadioDifHigh) << name;

        ProcessStrategy strategy{};
        int first = 0, second = 0, third = 0;
        std::vector<int> devices;
        GetProcessParameters("gpu:devices=1,2;threads=3", strategy, first, second, third, devices);
        EXPECT_EQ(devices, (std::vector<int>{1, 2})) << name;

        std::unique_ptr<TOSceneParser> scene(
            ParserFactory::CreateSceneParser(chain.dir.File("scene.xml")));
        scene->SetOrthoNoDataValue(-9999.5f);
        auto* points = new point2_t<double>[1] {
            { 500000.25, 4100000.5 }
        };
        const Polygon<double> footprint(points, 1);
        scene->SetSceneFootprint(&footprint);
        scene->Serialize(false);
        std::unique_ptr<TOSceneParser> back(
            ParserFactory::CreateSceneParser(chain.dir.File("scene.xml")));
        EXPECT_EQ(back->GetOrthoNoDataValue(), -9999.5f) << name;
        EXPECT_EQ(back->GetSceneFootprint()->points[0].x, 500000.25) << name;
        EXPECT_EQ(back->GetSceneFootprint()->points[0].y, 4100000.5) << name;
    }
    if (tried == 0)
        GTEST_SKIP() << "neither de_DE.UTF-8 nor tr_TR.UTF-8 is installed";
}

TEST(ParserFactory, EmptyFileNamesAreRefusedWithTheOperationsParameterName) {
    std::vector<unsigned int> dbic;
    std::vector<int> dbiw;
    const struct {
        std::function<void()> create;
        const char* parameter;
        const char* function;
    } cases[] = {
        {[] { delete ParserFactory::CreateFileListParser(""); }, "mfile", "CreateFileListParser"},
        {[] { delete ParserFactory::CreateImgSetParser("", RadioDifAny, 0); }, "ImgSet",
         "CreateImgSetParser"},
        {[] { delete ParserFactory::CreateSceneParser(""); }, "SceneXML", "CreateSceneParser"},
        {[] { delete ParserFactory::CreateTOMFileParser(""); }, "mfile", "CreateTOMFileParser"},
        {[&] { delete ParserFactory::CreateTPMFileParser("", dbic, 0, dbiw, "", 0); }, "mfile",
         "CreateTPMFileParser"},
    };
    for (const auto& c : cases) {
        if (const auto e = testsupport::Thrown<ParameterException>(c.create, c.function)) {
            EXPECT_EQ(e->GetErrorMessage(), "Empty filename");
            EXPECT_EQ(e->GetParameterName(), c.parameter);
            EXPECT_EQ(e->GetType(), ParameterException::EmptyValue);
            EXPECT_EQ(static_cast<int>(e->GetType()), 3);
            EXPECT_EQ(e->GetValue(), "");
            EXPECT_EQ(e->GetSourceFile(), "parserfactory.cpp");
            EXPECT_TRUE(testsupport::Contains(e->GetFunction(),
                                              std::string("ParserFactory::") + c.function))
                << e->GetFunction();
        }
    }
}

// Every parser refuses a file it cannot read ("Invalid MFILE") or without data lines ("Empty
// text file"), and a line index outside the file, from its own constructor or ParseLine; the
// factory lets the errors pass (the sanitizer build checks that nothing is left behind).
TEST(ParserFactory, EveryParserRefusesBadFilesAndIndices) {
    TempDir dir;
    const std::string missing = dir.File("no such file.txt");
    const std::string empty = WriteFile(dir.File("empty.txt"), "!MFILE\n\n  \n\t\r\n");
    const std::string two = WriteFile(dir.File("two.txt"), "!MFILE\na.tif;1;1\nb.tif;2;2\n");
    std::vector<unsigned int> dbic{1};
    std::vector<int> dbiw;
    const struct {
        const char* name;
        std::function<void(const std::string&, int)> open;
    } parsers[] = {
        {"FileListParser",
         [](const std::string& f, int i) {
             std::unique_ptr<FileListParser> p(ParserFactory::CreateFileListParser(f));
             p->ParseLine(i);
         }},
        {"TOImgSetParser",
         [](const std::string& f, int i) {
             std::unique_ptr<TOImgSetParser> p(
                 ParserFactory::CreateImgSetParser(f, RadioDifAny, 0));
             p->ParseLine(i);
         }},
        {"TPMFileParser",
         [&](const std::string& f, int i) {
             std::unique_ptr<TPMFileParser> p(
                 ParserFactory::CreateTPMFileParser(f, dbic, 0, dbiw, "", 0));
             p->ParseLine(i);
         }},
        {"TOMFileParser",
         [](const std::string& f, int) { delete ParserFactory::CreateTOMFileParser(f); }},
    };
    const std::string source[] = {"filelistparser.cpp", "toimgsetparser.cpp", "tpmfileparser.cpp",
                                  "tomfileparser.cpp"};
    for (std::size_t k = 0; k < 4; ++k) {
        const std::string name = parsers[k].name;
        for (const std::string& file : {missing, empty}) {
            if (const auto e = testsupport::Thrown<ParameterException>(
                    [&] { parsers[k].open(file, 0); }, name + " read " + file)) {
                EXPECT_EQ(e->GetErrorMessage(),
                          file == empty ? "Empty text file" : "Invalid MFILE");
                EXPECT_EQ(e->GetParameterName(), "MFILE");
                EXPECT_EQ(static_cast<int>(e->GetType()), 0);
                EXPECT_EQ(e->GetValue(), file);
                EXPECT_EQ(e->GetExpected(), "");
                EXPECT_TRUE(testsupport::Contains(e->GetFunction(),
                                                  name + "::" + name + "(const std::string&"))
                    << e->GetFunction();
                EXPECT_EQ(e->GetSourceFile(), source[k]);
            }
        }
        if (name == "TOMFileParser")
            continue;  // reads lines only for its writers
        for (const int index : {2, -1}) {
            if (const auto e =
                    testsupport::Thrown<DataException>([&] { parsers[k].open(two, index); },
                                                       name + " line " + std::to_string(index))) {
                EXPECT_EQ(e->GetErrorMessage(),
                          "Index " + std::to_string(index) + " is outside of valid range: 2");
                EXPECT_TRUE(testsupport::Contains(e->GetFunction(), name + "::ParseLine"));
                EXPECT_EQ(e->GetSourceFile(), source[k]);
            }
        }
    }
}

// A scene parser for a file not yet written holds its name and nothing read; a file that is
// malformed or misses elements is refused.
TEST(ParserFactory, SceneParserReadsAFileThatExistsAndRefusesABrokenOne) {
    TempDir dir;
    const std::string name = dir.File("later.xml");
    std::unique_ptr<TOSceneParser> scene(ParserFactory::CreateSceneParser(name));
    EXPECT_EQ(scene->GetXMLFilename(), name);
    EXPECT_EQ(scene->GetSceneFilename(), "");
    EXPECT_EQ(scene->GetMmseg(), -1);
    EXPECT_EQ(scene->GetSceneFootprint(), nullptr);
    const std::string malformed = WriteFile(dir.File("bad.xml"), "<TOSceneDesc_Document><Sou");
    EXPECT_THROW(delete ParserFactory::CreateSceneParser(malformed), kestrel::Exception);
    const std::string incomplete = WriteFile(dir.File("short.xml"),
                                             "<TOSceneDesc_Document><SourceRaster>a</SourceRaster>"
                                             "</TOSceneDesc_Document>");
    EXPECT_THROW(delete ParserFactory::CreateSceneParser(incomplete), FileAccessException);
}

namespace {

namespace fs = std::filesystem;
using kestrel::core::fileio::ScopedWriteLimit;

// Every file of a directory with its bytes.
std::map<std::string, std::string> Snapshot(const fs::path& dir) {
    std::map<std::string, std::string> files;
    for (const auto& entry : fs::directory_iterator(dir)) {
        if (entry.path().filename() != "filler")
            files[entry.path().filename().string()] = testsupport::ReadFile(entry.path().string());
    }
    return files;
}

// Names and sizes, for a failure message that stays readable.
std::string Describe(const std::map<std::string, std::string>& files) {
    std::string text;
    for (const auto& [name, bytes] : files)
        text += name + " (" + std::to_string(bytes.size()) + " bytes) ";
    return text;
}

// The writings of every kind of output into one directory: the preparation and image-set files
// of a master file of `lines` lines, and a scene of `lines` footprint points with its DTD.
std::vector<std::function<void()>> Writers(const TempDir& source, const fs::path& out, int lines) {
    std::string text = "!MFILE master\n";
    for (int i = 0; i < lines; ++i)
        text += "/data/scene_" + std::to_string(i) + ".tif;1,2;3;;0;5;low;2;fill\n";
    const std::string master =
        WriteFile(source.File("master" + std::to_string(lines) + ".txt"), text);
    auto parser = std::make_shared<TOMFileParser>(master);
    auto scene = std::make_shared<TOSceneParser>();
    scene->SetXMLFilename((out / "scene.xml").string());
    scene->SetSceneFilename("src.tif");
    auto* points = new point2_t<double>[static_cast<std::size_t>(lines)];
    for (int i = 0; i < lines; ++i)
        points[i] = {500000.25 + i, 4100000.5 - i};
    const Polygon<double> footprint(points, static_cast<unsigned int>(lines));
    scene->SetSceneFootprint(&footprint);
    return {[parser, out] { parser->WriteMFilePrep((out / "prep.txt").string()); },
            [parser, out] { parser->WriteImgSet((out / "imgset.txt").string()); },
            [scene] { scene->Serialize(false); }};
}

// Rewrites every output with more data than there is room for, then writes the scene without
// its DTD; every writing must fail and leave the directory as it was.
void ExpectFailedRewritesChangeNothing(const TempDir& source, const fs::path& out,
                                       const std::function<void()>& beforeEach) {
    const auto before = Snapshot(out);
    for (const auto& write : Writers(source, out, 3000)) {
        beforeEach();
        EXPECT_THROW(write(), FileAccessException);
        const auto after = Snapshot(out);
        EXPECT_TRUE(after == before) << Describe(after) << "instead of " << Describe(before);
    }
    fs::remove(out / "TOSceneDesc_Document.dtd");
    beforeEach();
    EXPECT_THROW(Writers(source, out, 3000)[2](), FileAccessException);
    auto withoutDtd = before;
    withoutDtd.erase("TOSceneDesc_Document.dtd");
    const auto after = Snapshot(out);
    EXPECT_TRUE(after == withoutDtd) << Describe(after) << "instead of " << Describe(withoutDtd);
}

}  // namespace

// A rewrite that fails part way (a full disk, injected here at every stage of the writing)
// leaves the previous file byte for byte and no temporary file.
TEST(FullDisk, FailedWritesLeaveThePreviousFiles) {
    for (const long long room : {0LL, 1LL, 700LL, 5000LL, 50000LL}) {
        TempDir dir;
        for (const auto& write : Writers(dir, dir.Path() / "out", 2)) {
            fs::create_directories(dir.Path() / "out");
            write();
        }
        std::unique_ptr<ScopedWriteLimit> limit;
        ExpectFailedRewritesChangeNothing(dir, dir.Path() / "out", [&] {
            limit.reset();
            limit = std::make_unique<ScopedWriteLimit>(room);
        });
    }
}

#if defined(__linux__)
// The same on a real full file system: a small tmpfs, filled up (needs the right to mount).
TEST(FullDisk, RewritesOnAFullFileSystemLeaveThePreviousFiles) {
    TempDir dir;
    const fs::path mnt = dir.Path() / "mnt";
    fs::create_directory(mnt);
    if (mount("tmpfs", mnt.c_str(), "tmpfs", 0, "size=256k") != 0)
        GTEST_SKIP() << "a tmpfs cannot be mounted here: " << std::strerror(errno);
    struct Unmount {
        const fs::path& path;
        ~Unmount() { umount2(path.c_str(), MNT_DETACH); }
    } unmount{mnt};
    for (const auto& write : Writers(dir, mnt, 2))
        write();
    std::FILE* filler = std::fopen((mnt / "filler").c_str(), "wb");
    ASSERT_NE(filler, nullptr);
    const std::string block(4096, 'f');
    while (std::fwrite(block.data(), 1, block.size(), filler) == block.size() &&
           std::fflush(filler) == 0) {
    }
    std::fclose(filler);
    ExpectFailedRewritesChangeNothing(dir, mnt, [] {});
}
#endif
