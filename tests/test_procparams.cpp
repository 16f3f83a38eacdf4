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

void ExpectParsed(const std::string& text, ProcessStrategy strategy, int first, int second,
                  int third, const std::vector<int>& list) {
    SCOPED_TRACE("PROC \"" + text + "\"");
    const Parsed p = Read(text);
    EXPECT_EQ(p.strategy, strategy);
    EXPECT_EQ(p.first, first);
    EXPECT_EQ(p.second, second);
    EXPECT_EQ(p.third, third);
    EXPECT_EQ(p.list, list);
}

}  // namespace

TEST(ProcOption, AutomaticChoiceAndCentralProcessor) {
    ExpectParsed("", PROCESS_STRATEGY_AUTO, 0, 0, 0, {});
    ExpectParsed(" \t ", PROCESS_STRATEGY_AUTO, 0, 0, 0, {});
    ExpectParsed("auto", PROCESS_STRATEGY_AUTO, 0, 0, 0, {});
    ExpectParsed(" Auto : 8 ", PROCESS_STRATEGY_AUTO, 8, 0, 0, {});
    ExpectParsed("CPU", PROCESS_STRATEGY_CPU, 0, 0, 0, {});
    ExpectParsed("cpu:12", PROCESS_STRATEGY_CPU, 12, 0, 0, {});
    ExpectParsed("CPU: Threads = 3", PROCESS_STRATEGY_CPU, 3, 0, 0, {});
    ExpectParsed("CPU:2147483647", PROCESS_STRATEGY_CPU, 2147483647, 0, 0, {});
}

TEST(ProcOption, GraphicsProcessorByDeviceNumbersOrCount) {
    ExpectParsed("GPU", PROCESS_STRATEGY_GPU, 0, 0, 0, {});
    ExpectParsed("GPU:0", PROCESS_STRATEGY_GPU, 0, 0, 0, {0});
    ExpectParsed(" gpu : 3, 1 ;threads=4; STREAMS = 2", PROCESS_STRATEGY_GPU, 4, 2, 0, {3, 1});
    ExpectParsed("GPU:streams=1;devices=2", PROCESS_STRATEGY_GPU, 0, 1, 0, {2});
    ExpectParsed("GPU:count=2;streams=3;threads=5", PROCESS_STRATEGY_GPU, 5, 3, 2, {});
}

TEST(ProcOption, UnreadableTextQuotesItListsFormsAndLeavesOutputsAlone) {
    const char* const texts[] = {"FPGA",
                                 "CPU:",
                                 "CPU:-1",
                                 "CPU:+4",
                                 "CPU:4x",
                                 "CPU:4;",
                                 "CPU:4;threads=2",
                                 "CPU:2147483648",
                                 "CPU:streams=2",
                                 "AUTO:count=1",
                                 "CPU:0,1",
                                 "GPU:0,,1",
                                 "GPU:1,1",
                                 "GPU:0;count=2",
                                 "GPU:count=0",
                                 "GPU:bogus=1",
                                 "GPU;",
                                 "GPU:threads=1;threads=2"};
    for (const std::string text : texts) {
        SCOPED_TRACE("PROC \"" + text + "\"");
        Parsed p;
        try {
            GetProcessParameters(text, p.strategy, p.first, p.second, p.third, p.list);
            ADD_FAILURE() << "accepted";
        } catch (const DataException& e) {
            const std::string message = e.what();
            EXPECT_NE(message.find("Cannot read PROC option \"" + text + "\": "), std::string::npos)
                << message;
            EXPECT_NE(message.find("\"CPU[:threads]\""), std::string::npos) << message;
            EXPECT_NE(message.find("\"GPU[:settings]\""), std::string::npos) << message;
            EXPECT_NE(e.GetFunction().find("GetProcessParameters("), std::string::npos);
            EXPECT_EQ(e.GetSourceFile(), "processparams.cpp");
        }
        EXPECT_EQ(p.strategy, 99);
        EXPECT_EQ(p.first, 99);
        EXPECT_EQ(p.list, std::vector<int>{99});
    }
}

TEST(ProcOption, InstalledReaderIsUsedUntilItsScopeEnds) {
    {
        ScopedProcessParametersReader reader([](const std::string&, ProcessStrategy& strategy,
                                                int& first, int& second, int& third,
                                                std::vector<int>& list) {
            strategy = static_cast<ProcessStrategy>(5);
            first = second = third = 1;
            list.clear();
        });
        EXPECT_EQ(Read("CPU:4").strategy, 5);
    }
    EXPECT_EQ(Read("CPU:4").strategy, PROCESS_STRATEGY_CPU);
}

TEST(TrueOrthoFactory, BuiltInMakesCentralProcessorGeneratorsOnly) {
    std::unique_ptr<ITrueOrtho> cpu(TrueOrthoFactory::CreateCPUGenerator(GENERATOR_TORTHO, 4));
    ASSERT_NE(dynamic_cast<TorthoGenerator*>(cpu.get()), nullptr);
    EXPECT_EQ(cpu->GetProcessor(), ProcessorKind::Central);
    EXPECT_EQ(cpu->GetThreadCount(), 4u);
    EXPECT_TRUE(cpu->GetDevices().empty());

    // No graphics processor is usable, so the automatic choice is the central processor.
    std::unique_ptr<ITrueOrtho> automatic(
        TrueOrthoFactory::CreateGenerator(GENERATOR_OCCLUSION_RECOVERY, 2));
    ASSERT_NE(dynamic_cast<OcclusionRecovery*>(automatic.get()), nullptr);
    EXPECT_EQ(automatic->GetGeneratorType(), GENERATOR_OCCLUSION_RECOVERY);
    EXPECT_EQ(automatic->GetProcessor(), ProcessorKind::Central);
    EXPECT_EQ(automatic->GetThreadCount(), 2u);

    EXPECT_EQ(TrueOrthoFactory::CreateCudaGenerator(GENERATOR_TORTHO, {0}, 1, 1), nullptr);
    EXPECT_EQ(TrueOrthoFactory::CreateCudaGenerator(GENERATOR_TORTHO, 1u, 0u, 1u), nullptr);
}

TEST(TrueOrthoFactory, UnknownGeneratorTypeIsRefusedByEveryCall) {
    const auto bad = static_cast<GeneratorType>(7);
    EXPECT_THROW(TrueOrthoFactory::CreateGenerator(bad, 1), DataException);
    EXPECT_THROW(TrueOrthoFactory::CreateCPUGenerator(bad, 1), DataException);
    EXPECT_THROW(TrueOrthoFactory::CreateCudaGenerator(bad, {0}, 1, 1), DataException);
    EXPECT_THROW(TrueOrthoFactory::CreateCudaGenerator(bad, 1u, 1u, 1u), DataException);
}

TEST(TrueOrthoFactory, InstalledImplementationIsUsedUntilItsScopeEnds) {
    class GraphicsOnly : public TrueOrthoFactoryImpl {
      public:
        ITrueOrtho* CreateGenerator(GeneratorType, unsigned int) override { return nullptr; }
        ITrueOrtho* CreateCPUGenerator(GeneratorType, unsigned int) override { return nullptr; }
        ITrueOrtho* CreateCudaGenerator(GeneratorType, const std::vector<int>& devices,
                                        unsigned int threads, unsigned int streams) override {
            GeneratorSettings s;
            s.processor = ProcessorKind::Graphics;
            s.devices = devices;
            s.threadCount = threads;
            s.streamCount = streams;
            return new TorthoGenerator(s);
        }
        ITrueOrtho* CreateCudaGenerator(GeneratorType, unsigned int, unsigned int,
                                        unsigned int) override {
            return nullptr;
        }
    };
    {
        ScopedTrueOrthoFactoryImpl scope(std::make_shared<GraphicsOnly>());
        std::unique_ptr<ITrueOrtho> gpu(
            TrueOrthoFactory::CreateCudaGenerator(GENERATOR_TORTHO, {2, 0}, 3, 4));
        ASSERT_TRUE(gpu);
        EXPECT_EQ(gpu->GetProcessor(), ProcessorKind::Graphics);
        EXPECT_EQ(gpu->GetDevices(), (std::vector<int>{2, 0}));
        EXPECT_EQ(gpu->GetThreadCount(), 3u);
        EXPECT_EQ(gpu->GetStreamCount(), 4u);
        EXPECT_EQ(TrueOrthoFactory::CreateCPUGenerator(GENERATOR_TORTHO, 1), nullptr);
    }
    std::unique_ptr<ITrueOrtho> cpu(TrueOrthoFactory::CreateCPUGenerator(GENERATOR_TORTHO, 1));
    EXPECT_TRUE(cpu);
    EXPECT_EQ(TrueOrthoFactory::SetImplementation(nullptr),
              TrueOrthoFactory::GetDefaultImplementation());
}
