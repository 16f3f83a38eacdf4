// The workflow's file chain through files on disk: a master file, the two files derived from
// it, and those read back through the parser factory with typed values.
#include <silvan/parserfactory.h>

#include "support.h"

#include <functional>
#include <memory>

using kestrel::DataException;
using kestrel::FileAccessException;
using kestrel::ParameterException;
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

TEST(FileChain, PreparationFileReadsBackTypedWithDefaultsForEmptyColumns) {
    Chain chain;
    std::vector<unsigned int> dbic{9};
    std::vector<int> dbiw{-1, 8};
    std::unique_ptr<TPMFileParser> prep(
        ParserFactory::CreateTPMFileParser(chain.prep, dbic, 11, dbiw, "-32768", 4));
    ASSERT_EQ(prep->GetMfileLines(), 3u);

    prep->ParseLine(0);
    EXPECT_EQ(prep->GetFili(), "/data/a.tif");
    EXPECT_EQ(prep->GetDbic(), (std::vector<unsigned int>{1, 2, 3}));
    EXPECT_EQ(prep->GetMmseg(), 7);
    EXPECT_EQ(prep->GetDbiw(), (std::vector<int>{0, 16}));
    EXPECT_EQ(prep->GetSrcBgd(), "0");
    EXPECT_EQ(prep->GetEdgeClip(), 5);

    prep->ParseLine(1);
    EXPECT_EQ(prep->GetFili(), "D:\\data\\b.tif");
    EXPECT_EQ(prep->GetDbic(), (std::vector<unsigned int>{4}));
    EXPECT_EQ(prep->GetMmseg(), 3);
    EXPECT_EQ(prep->GetDbiw(), (std::vector<int>{-1, 8}));
    EXPECT_EQ(prep->GetSrcBgd(), "255");
    EXPECT_EQ(prep->GetEdgeClip(), 4);

    prep->ParseLine(2);
    EXPECT_EQ(prep->GetFili(), "c.tif");
    EXPECT_EQ(prep->GetDbic(), (std::vector<unsigned int>{9}));
    EXPECT_EQ(prep->GetMmseg(), 11);
    EXPECT_EQ(prep->GetDbiw(), (std::vector<int>{1}));
    EXPECT_EQ(prep->GetSrcBgd(), "-32768");
    EXPECT_EQ(prep->GetEdgeClip(), 1);
}

TEST(FileChain, ImgSetFileReadsBackWithoutPreparationLines) {
    Chain chain;
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
        try {
            c.create();
            ADD_FAILURE() << c.function << " accepted an empty name";
        } catch (const ParameterException& e) {
            EXPECT_EQ(e.GetErrorMessage(), "Empty filename");
            EXPECT_EQ(e.GetParameterName(), c.parameter);
            EXPECT_EQ(e.GetType(), ParameterException::EmptyValue);
            EXPECT_EQ(static_cast<int>(e.GetType()), 3);
            EXPECT_EQ(e.GetValue(), "");
            EXPECT_EQ(e.GetSourceFile(), "parserfactory.cpp");
            EXPECT_NE(e.GetFunction().find(std::string("ParserFactory::") + c.function),
                      std::string::npos)
                << e.GetFunction();
        }
    }
}

// Constructor failures pass through; the sanitizer build checks that nothing is left behind.
TEST(ParserFactory, ConstructorErrorsPassThrough) {
    TempDir dir;
    const std::string empty = WriteFile(dir.File("empty.txt"), "!MFILE\n");
    std::vector<unsigned int> dbic;
    std::vector<int> dbiw;
    EXPECT_THROW(delete ParserFactory::CreateFileListParser(empty), ParameterException);
    EXPECT_THROW(delete ParserFactory::CreateTOMFileParser(dir.File("missing")),
                 ParameterException);
    EXPECT_THROW(delete ParserFactory::CreateImgSetParser(empty, RadioDifAny, 0),
                 ParameterException);
    EXPECT_THROW(delete ParserFactory::CreateTPMFileParser("  ", dbic, 0, dbiw, "", 0),
                 ParameterException);
}

TEST(ParserFactory, SceneParserForAMissingFileHoldsTheNameAndNothingRead) {
    TempDir dir;
    const std::string name = dir.File("later.xml");
    std::unique_ptr<TOSceneParser> scene(ParserFactory::CreateSceneParser(name));
    EXPECT_EQ(scene->GetXMLFilename(), name);
    EXPECT_EQ(scene->GetSceneFilename(), "");
    EXPECT_EQ(scene->GetMmseg(), -1);
    EXPECT_EQ(scene->GetSceneFootprint(), nullptr);
}

TEST(ParserFactory, SceneParserForAWrittenFileIsFilled) {
    TempDir dir;
    const std::string name = dir.File("scene.xml");
    {
        std::unique_ptr<TOSceneParser> scene(ParserFactory::CreateSceneParser(name));
        scene->SetSceneFilename("a.tif");
        scene->SetOrthoFilename("a_ortho.tif");
        scene->SetVisIdxFilename("a_vis.tif");
        scene->SetElevMapFilename("a_elev.tif");
        scene->SetMmseg(3);
        auto* points = new point2_t<double>[4] {
            {0, 0}, {10, 0}, {10, 10}, {
                0, 10
            }
        };
        const Polygon<double> footprint(points, 4);
        scene->SetSceneFootprint(&footprint);
        scene->Serialize(false);
    }
    std::unique_ptr<TOSceneParser> scene(ParserFactory::CreateSceneParser(name));
    EXPECT_EQ(scene->GetSceneFilename(), "a.tif");
    EXPECT_EQ(scene->GetElevMapFilename(), "a_elev.tif");
    EXPECT_EQ(scene->GetMmseg(), 3);
    ASSERT_NE(scene->GetSceneFootprint(), nullptr);
    EXPECT_EQ(scene->GetSceneFootprint()->numPoints, 4u);
}

TEST(ParserFactory, SceneParserForABrokenFileThrowsAndKeepsNothing) {
    TempDir dir;
    const std::string malformed = WriteFile(dir.File("bad.xml"), "<TOSceneDesc_Document><Sou");
    EXPECT_THROW(delete ParserFactory::CreateSceneParser(malformed), kestrel::Exception);
    const std::string incomplete = WriteFile(dir.File("short.xml"),
                                             "<TOSceneDesc_Document><SourceRaster>a</SourceRaster>"
                                             "</TOSceneDesc_Document>");
    EXPECT_THROW(delete ParserFactory::CreateSceneParser(incomplete), FileAccessException);
}
