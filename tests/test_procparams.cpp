// The PROC option reader and the generator factory's built-in implementation.
#include <kestrel/processparams.h>
#include <kestrel/trueortho.h>

#include "support.h"

#include <memory>

using kestrel::DataException;
using namespace kestrel::processes;

namespace {

struct Parsed {
    ProcessStrategy strategy = static_cast<ProcessStrategy>(99);
    int first = 99, second = 99, third = 99;
    std::vector<int> list{99};
};

Parsed Read(const std::string& text) {
    Parsed p;
    GetProcessParameters(text, p.strategy, p.first, p.second, p.third, p.list);
    return p;
}

// The outputs as one text: strategy, first, second, third, [list].
std::string Show(const std::string& text) {
    const Parsed p = Read(text);
    std::string out = std::vector<std::string>{"AUTO", "CPU", "GPU"}.at(p.strategy);
    for (int n : {p.first, p.second, p.third})
        out += " " + std::to_string(n);
    out += " [";
    for (std::size_t i = 0; i < p.list.size(); ++i)
        out += (i ? "," : "") + std::to_string(p.list[i]);
    return out + "]";
}

}  // namespace

TEST(ProcOption, EveryFormGivesStrategyNumbersAndDevices) {
    EXPECT_EQ(Show(""), "AUTO 0 0 0 []");
    EXPECT_EQ(Show(" \t "), "AUTO 0 0 0 []");
    EXPECT_EQ(Show("auto"), "AUTO 0 0 0 []");
    EXPECT_EQ(Show(" Auto : 8 "), "AUTO 8 0 0 []");
    EXPECT_EQ(Show("CPU"), "CPU 0 0 0 []");
    EXPECT_EQ(Show("cpu:12"), "CPU 12 0 0 []");
    EXPECT_EQ(Show("CPU: Threads = 3"), "CPU 3 0 0 []");
    EXPECT_EQ(Show("CPU:2147483647"), "CPU 2147483647 0 0 []");
    EXPECT_EQ(Show("GPU"), "GPU 0 0 0 []");
    EXPECT_EQ(Show("GPU:0"), "GPU 0 0 0 [0]");
    EXPECT_EQ(Show(" gpu : 3, 1 ;threads=4; STREAMS = 2"), "GPU 4 2 0 [3,1]");
    EXPECT_EQ(Show("GPU:streams=1;devices=2"), "GPU 0 1 0 [2]");
    EXPECT_EQ(Show("GPU:count=2;streams=3;threads=5"), "GPU 5 3 2 []");
}

TEST(ProcOption, UnreadableTextIsQuotedWholeAndLeavesOutputsAlone) {
    for (const std::string text :
         {"FPGA", "CPU:", "CPU:-1", "CPU:+4", "CPU:4x", "CPU:4;", "CPU:4;threads=2",
          "CPU:2147483648", "CPU:streams=2", "AUTO:count=1", "CPU:0,1", "GPU:0,,1", "GPU:1,1",
          "GPU:0;count=2", "GPU:count=0", "GPU:bogus=1", "GPU;", "GPU:threads=1;threads=2"}) {
        SCOPED_TRACE("PROC \"" + text + "\"");
        Parsed p;
        if (const auto e = testsupport::Thrown<DataException>([&] {
                GetProcessParameters(text, p.strategy, p.first, p.second, p.third, p.list);
            })) {
            for (const std::string& part :
                 {"Cannot read PROC option \"" + text + "\": ", std::string("\"CPU[:threads]\""),
                  std::string("\"GPU[:settings]\"")})
                EXPECT_TRUE(testsupport::Contains(e->what(), part)) << e->what();
            EXPECT_TRUE(testsupport::Contains(e->GetFunction(), "GetProcessParameters("));
            EXPECT_EQ(e->GetSourceFile(), "processparams.cpp");
        }
        EXPECT_EQ(p.strategy, 99);
        EXPECT_EQ(p.first, 99);
        EXPECT_EQ(p.list, std::vector<int>{99});
    }
    // The message shows the whole text, a NUL or other control byte included.
    const std::string message =
        testsupport::ThrownMessage<DataException>([] { Read(std::string("CPU:4\0x\n", 8)); });
    EXPECT_TRUE(testsupport::Contains(message, "\"CPU:4\\x00x\\x0A\"")) << message;
}

TEST(ProcOption, InstalledReaderIsUsedUntilItsScopeEnds) {
    {
        ScopedProcessParametersReader reader(
            [](const std::string&, ProcessStrategy& strategy, int&, int&, int&, std::vector<int>&) {
                strategy = static_cast<ProcessStrategy>(5);
            });
        EXPECT_EQ(Read("CPU:4").strategy, 5);
    }
    EXPECT_EQ(Read("CPU:4").strategy, PROCESS_STRATEGY_CPU);
}

TEST(TrueOrthoFactory, BuiltInRefusesUnknownGeneratorTypes) {
    const auto bad = static_cast<GeneratorType>(7);
    EXPECT_THROW(TrueOrthoFactory::CreateGenerator(bad, 1), DataException);
    EXPECT_THROW(TrueOrthoFactory::CreateCPUGenerator(bad, 1), DataException);
    EXPECT_THROW(TrueOrthoFactory::CreateCudaGenerator(bad, {0}, 1, 1), DataException);
    EXPECT_THROW(TrueOrthoFactory::CreateCudaGenerator(bad, 1u, 1u, 1u), DataException);
}
