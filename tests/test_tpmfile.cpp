// The preparation parameter file parser: typed columns, the process's defaults and errors.
#include <silvan/tpmfileparser.h>

#include "support.h"

#include <atomic>
#include <memory>
#include <thread>

using kestrel::DataException;
using kestrel::processes::silvan::TPMFileParser;
using testsupport::TempDir;
using testsupport::WriteFile;

namespace {

using Channels = std::vector<unsigned int>;
using Ints = std::vector<int>;

// A parser with the process defaults channels 4,5, segment 2, dbiw 10,20, background "0" and
// edge clipping 3.
std::unique_ptr<TPMFileParser> Open(const std::string& path, Channels dbic = {4, 5}) {
    Ints dbiw{10, 20};
    return std::make_unique<TPMFileParser>(path, dbic, 2, dbiw, "0", 3);
}

std::string WritePrep(const TempDir& dir, const std::string& lines) {
    return WriteFile(dir.File("prep.txt"), "!MFILE created for VARNOK\n" + lines);
}

void ExpectLine(const TPMFileParser& p, const std::string& fili, const Channels& dbic, int mmseg,
                const Ints& dbiw, const std::string& srcBgd, int edgeClip) {
    EXPECT_EQ(p.GetFili(), fili);
    EXPECT_EQ(p.GetDbic(), dbic);
    EXPECT_EQ(p.GetMmseg(), mmseg);
    EXPECT_EQ(p.GetDbiw(), dbiw);
    EXPECT_EQ(p.GetSrcBgd(), srcBgd);
    EXPECT_EQ(p.GetEdgeClip(), edgeClip);
}

}  // namespace

// Lines are read in any order and nothing of one line stays in the next; columns left out or
// empty read as the process's values, the channel list expanded like a read one.
TEST(TPMFileParser, ReadsTypedLinesAndProcessDefaults) {
    TempDir dir;
    auto p = Open(WritePrep(dir,
                            "a.tif;3;1;;-9999;0\n"
                            "d:\\img\\b.tif;1,2,3,4;7;0,1,-2;none;12\n"
                            "c.tif\n"
                            ";;;;;\n"));
    ExpectLine(*p, "", {}, 0, {}, "", 0);
    ASSERT_EQ(p->GetMfileLines(), 4u);
    p->ParseLine(1);
    ExpectLine(*p, "d:\\img\\b.tif", {1, 2, 3, 4}, 7, {0, 1, -2}, "none", 12);
    p->ParseLine(0);
    ExpectLine(*p, "a.tif", {3}, 1, {10, 20}, "-9999", 0);
    p->ParseLine(2);
    ExpectLine(*p, "c.tif", {4, 5}, 2, {10, 20}, "0", 3);
    p->ParseLine(3);
    ExpectLine(*p, "", {4, 5}, 2, {10, 20}, "0", 3);
}

// A channel list naming no channel is refused, whether it comes from the line or from the
// process default; a default channel number above INT_MAX does not come back as a channel.
TEST(TPMFileParser, ChannelListsNamingNoChannelAreRefused) {
    TempDir dir;
    const std::string path = WritePrep(dir, "a.tif;1;1\nb.tif;2,0;2\nc.tif\n");
    auto p = Open(path, {1, 4294967295u});
    p->ParseLine(0);
    const auto e = testsupport::Thrown<DataException>([&] { p->ParseLine(1); });
    EXPECT_TRUE(e && testsupport::Contains(e->GetErrorMessage(), "\"2,0\""));
    // The columns before the channel list hold the new line, the later ones the old.
    EXPECT_EQ(p->GetFili(), "b.tif");
    EXPECT_EQ(p->GetMmseg(), 1);
    EXPECT_THROW(p->ParseLine(2), DataException);
    EXPECT_EQ(p->GetDbic(), (Channels{1}));
}

// Copies, made by construction or assignment, outlive the original and share nothing that
// reading writes: used on several threads at once, each reads its own lines intact.
TEST(TPMFileParser, CopiesAreIndependentAcrossThreads) {
    TempDir dir;
    const int lines = 300;
    // Lists of many lengths, so that a list shared between threads would be seen torn.
    const auto dbiwOf = [](int i) {
        Ints list;
        for (int k = 0; k < 1 + (i * 7) % 40; ++k)
            list.push_back(i * 100 + k);
        return list;
    };
    std::string text;
    for (int i = 0; i < lines; ++i) {
        std::string dbiw;
        for (const int v : dbiwOf(i))
            dbiw += (dbiw.empty() ? "" : ",") + std::to_string(v);
        text += "s" + std::to_string(i) + ";" + std::to_string(i % 7 + 1) + "," +
                std::to_string(i % 5 + 1) + ";" + std::to_string(i) + ";" + dbiw + "\n";
    }
    auto original = Open(WritePrep(dir, text));
    std::vector<TPMFileParser> copies(3, *original);
    copies.push_back(*Open(WriteFile(dir.File("other.txt"), "x.tif\n")));
    copies.back() = *original;
    original.reset();

    std::atomic<int> wrong{0};
    std::vector<std::thread> threads;
    for (TPMFileParser& parser : copies) {
        threads.emplace_back([&parser, &wrong, &dbiwOf] {
            for (int round = 0; round < 20; ++round) {
                for (int i = 0; i < lines; ++i) {
                    parser.ParseLine(i);
                    const Channels dbic{static_cast<unsigned int>(i % 7 + 1),
                                        static_cast<unsigned int>(i % 5 + 1)};
                    if (parser.GetDbic() != dbic || parser.GetDbiw() != dbiwOf(i) ||
                        parser.GetMmseg() != i)
                        ++wrong;
                }
            }
        });
    }
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_EQ(wrong, 0);
    EXPECT_EQ(copies.back().GetMfileLines(), static_cast<unsigned int>(lines));
}
