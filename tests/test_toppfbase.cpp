// The true-ortho process base: copies and the cancel flag, and generator creation from the PROC
// option through every strategy, the fallback and the kind checks.
#include <silvan/toppfbase.h>

#include "support.h"

#include <memory>
#include <set>
#include <sstream>

using kestrel::DataException;
using kestrel::processes::silvan::TOPPFBase;
using namespace kestrel::processes;
using Calls = std::vector<std::string>;

namespace {

// A process that exposes what the base keeps for derived processes.
class Process : public TOPPFBase {
  public:
    void Execute() override {}
    std::string Proc() const { return proc; }
    std::vector<int> Values() const {
        return {processValue1, processValue2, processValue3, processValue4};
    }
    void SetValues(int a, int b, int c, int d) {
        processValue1 = a, processValue2 = b, processValue3 = c, processValue4 = d;
    }
};

// Generators alive; every test ends with none.
int liveGenerators = 0;

template <class Base>
struct Counted : Base {
    Counted() : Base(GeneratorSettings()) { ++liveGenerators; }
    ~Counted() override { --liveGenerators; }
};

template <class... A>
std::string Args(A... args) {
    std::ostringstream out;
    ((out << (out.tellp() ? ", " : "") << args), ...);
    return out.str();
}

// Records every call with its arguments and answers each call as told.
class RecordingFactory : public TrueOrthoFactoryImpl {
  public:
    Calls calls;
    std::set<std::string> nulls;  // names of the calls that give null
    bool swapped = false;         // gives a generator of the other kind

    ITrueOrtho* CreateGenerator(GeneratorType type, unsigned int threads) override {
        return Record("CreateGenerator", type, Args(type, threads));
    }
    ITrueOrtho* CreateCPUGenerator(GeneratorType type, unsigned int threads) override {
        return Record("CreateCPUGenerator", type, Args(type, threads));
    }
    ITrueOrtho* CreateCudaGenerator(GeneratorType type, const std::vector<int>& devices,
                                    unsigned int threads, unsigned int streams) override {
        std::string list;
        for (int d : devices)
            list += (list.empty() ? "" : ",") + std::to_string(d);
        return Record("CreateCudaGenerator", type, Args(type, "[" + list + "]", threads, streams));
    }
    ITrueOrtho* CreateCudaGenerator(GeneratorType type, unsigned int threads, unsigned int count,
                                    unsigned int streams) override {
        return Record("CreateCudaGenerator", type, Args(type, threads, count, streams));
    }

  private:
    ITrueOrtho* Record(const std::string& name, GeneratorType type, const std::string& args) {
        calls.push_back(name + "(" + args + ")");
        if (nulls.count(name))
            return nullptr;
        if ((type == GENERATOR_TORTHO) != swapped)
            return new Counted<TorthoGenerator>;
        return new Counted<OcclusionRecovery>;
    }
};

class ProcessBase : public ::testing::Test {
  protected:
    ProcessBase() : factory(std::make_shared<RecordingFactory>()), scope(factory) {}
    void TearDown() override { EXPECT_EQ(liveGenerators, 0); }

    // Creates a generator of the given kind and returns the calls made for it.
    Calls CallsFor(const std::string& procText, GeneratorType type) {
        factory->calls.clear();
        process.SetProc(procText);
        std::unique_ptr<ITrueOrtho> g(
            type == GENERATOR_TORTHO ? static_cast<ITrueOrtho*>(process.CreateTorthoGenerator())
                                     : process.CreateOcclusionRecovery());
        EXPECT_TRUE(g);
        return factory->calls;
    }

    std::shared_ptr<RecordingFactory> factory;
    ScopedTrueOrthoFactoryImpl scope;
    Process process;
};

void ExpectThrownAt(const kestrel::Exception& e, const std::string& function) {
    EXPECT_NE(e.GetFunction().find("TOPPFBase::" + function + "("), std::string::npos);
    EXPECT_EQ(e.GetSourceFile(), "toppfbase.cpp");
}

}  // namespace

TEST(ProcessMembers, CopiesKeepTheMembersButHaveTheirOwnCancelFlag) {
    Process a;
    a.SetProc("CPU:2");
    a.SetValues(5, 6, 7, 8);
    bool* flag = a.GetCancelFlag();
    *flag = true;  // as whoever was handed the address would
    Process b(a);
    Process c;
    c = a;
    c = *&c;
    for (Process* p : {&b, &c}) {
        EXPECT_EQ(p->Proc(), "CPU:2");
        EXPECT_EQ(p->Values(), (std::vector<int>{5, 6, 7, 8}));
        EXPECT_NE(p->GetCancelFlag(), flag);
        EXPECT_TRUE(*p->GetCancelFlag());
        p->SetCancelFlag(false);
    }
    EXPECT_TRUE(*flag);
    EXPECT_EQ(a.GetCancelFlag(), flag);
}

TEST_F(ProcessBase, EachStrategyCallsItsFactoryWithItsArgumentsOthersTheAutomaticOne) {
    for (GeneratorType t : {GENERATOR_TORTHO, GENERATOR_OCCLUSION_RECOVERY}) {
        const std::string k = std::to_string(t);
        EXPECT_EQ(CallsFor("", t), Calls{"CreateGenerator(" + k + ", 0)"});
        EXPECT_EQ(CallsFor("AUTO:6", t), Calls{"CreateGenerator(" + k + ", 6)"});
        EXPECT_EQ(CallsFor("CPU:4", t), Calls{"CreateCPUGenerator(" + k + ", 4)"});
        // List overload: (type, list, first, second).
        EXPECT_EQ(CallsFor("GPU:3,1;threads=2;streams=5", t),
                  Calls{"CreateCudaGenerator(" + k + ", [3,1], 2, 5)"});
        // Three-integer overload: (type, first, third, second).
        EXPECT_EQ(CallsFor("GPU:count=7;threads=6;streams=3", t),
                  Calls{"CreateCudaGenerator(" + k + ", 6, 7, 3)"});
    }
    // Any other strategy value: the automatic choice, without the thread count.
    ScopedProcessParametersReader reader([](const std::string&, ProcessStrategy& s, int& first,
                                            int& second, int& third, std::vector<int>& list) {
        s = static_cast<ProcessStrategy>(5);
        first = 7, second = 8, third = 9, list = {1};
    });
    EXPECT_EQ(CallsFor("X", GENERATOR_TORTHO), Calls{"CreateGenerator(0, 0)"});
    EXPECT_EQ(CallsFor("Y", GENERATOR_OCCLUSION_RECOVERY), Calls{"CreateGenerator(1, 0)"});
}

TEST_F(ProcessBase, NullFromGraphicsProcessorFallsBackToCentralProcessor) {
    factory->nulls = {"CreateCudaGenerator"};
    EXPECT_EQ(CallsFor("GPU:0;threads=3", GENERATOR_TORTHO),
              (Calls{"CreateCudaGenerator(0, [0], 3, 0)", "CreateCPUGenerator(0, 3)"}));
    EXPECT_EQ(CallsFor("GPU:streams=2;threads=4", GENERATOR_OCCLUSION_RECOVERY),
              (Calls{"CreateCudaGenerator(1, 4, 0, 2)", "CreateCPUGenerator(1, 4)"}));
}

TEST(ProcessBaseBuiltIn, WithoutGraphicsProcessorEveryTextGivesCentralProcessorGenerator) {
    // Installing and removing another factory brings the built-in one back.
    const auto other = std::make_shared<RecordingFactory>();
    EXPECT_EQ(TrueOrthoFactory::SetImplementation(other),
              TrueOrthoFactory::GetDefaultImplementation());
    EXPECT_EQ(TrueOrthoFactory::SetImplementation(nullptr), other);

    Process process;
    for (const char* text : {"", "AUTO:2", "CPU:2", "GPU:0,1;threads=2", "GPU:threads=2"}) {
        SCOPED_TRACE(text);
        process.SetProc(text);
        std::unique_ptr<TorthoGenerator> g(process.CreateTorthoGenerator());
        ASSERT_TRUE(g);
        EXPECT_EQ(g->GetProcessor(), ProcessorKind::Central);
        EXPECT_EQ(g->GetThreadCount(), text[0] ? 2u : 0u);
    }
}

// No generator obtained names the PROC text; an unreadable one is refused before any factory
// call.
TEST_F(ProcessBase, NoGeneratorObtainedNamesTheProcText) {
    process.SetProc("GPU:x");
    EXPECT_THROW(delete process.CreateTorthoGenerator(), DataException);
    EXPECT_TRUE(factory->calls.empty());
    factory->nulls = {"CreateCudaGenerator", "CreateCPUGenerator", "CreateGenerator"};
    const std::pair<const char*, std::size_t> cases[] = {{"GPU:1", 2}, {"CPU", 1}, {"", 1}};
    for (const auto& c : cases) {
        factory->calls.clear();
        process.SetProc(c.first);
        if (const auto e = testsupport::Thrown<DataException>(
                [&] { delete process.CreateTorthoGenerator(); }, c.first)) {
            EXPECT_EQ(e->what(), std::string("Failed to instantiate an trueortho generator with "
                                             "PROC option set to \"") +
                                     c.first + "\"");
            ExpectThrownAt(*e, "CreateTrueortho");
        }
        EXPECT_EQ(factory->calls.size(), c.second) << c.first;
    }
}

TEST_F(ProcessBase, GeneratorOfWrongKindIsReleasedAndRefused) {
    process.SetProc("CPU:1");
    factory->swapped = true;
    for (bool tortho : {true, false}) {
        if (const auto e = testsupport::Thrown<DataException>([&] {
                if (tortho)
                    delete process.CreateTorthoGenerator();
                else
                    delete process.CreateOcclusionRecovery();
            })) {
            EXPECT_STREQ(e->what(), "The trueortho generator is not of the expected type");
            ExpectThrownAt(*e, tortho ? "CreateTorthoGenerator" : "CreateOcclusionRecovery");
        }
        EXPECT_EQ(liveGenerators, 0);
    }
}
