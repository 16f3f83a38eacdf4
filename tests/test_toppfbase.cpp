// The true-ortho process base: members and copies, the cancel flag, and generator creation from
// the PROC option through every strategy, the fallback and the kind checks.
#include <silvan/toppfbase.h>

#include "support.h"

#include <map>
#include <memory>
#include <sstream>

using kestrel::DataException;
using kestrel::processes::silvan::TOPPFBase;
using namespace kestrel::processes;

namespace {

// A process that exposes what the base keeps for derived processes.
class Process : public TOPPFBase {
  public:
    void Execute() override {}
    using TOPPFBase::CreateTrueortho;
    std::string Proc() const { return proc; }
    std::vector<int> Values() const {
        return {processValue1, processValue2, processValue3, processValue4};
    }
    void SetValues(int a, int b, int c, int d) {
        processValue1 = a;
        processValue2 = b;
        processValue3 = c;
        processValue4 = d;
    }
};

// Generators alive; every test ends with none.
int liveGenerators = 0;

template <class Base>
class Counted : public Base {
  public:
    explicit Counted(GeneratorSettings s = GeneratorSettings()) : Base(std::move(s)) {
        ++liveGenerators;
    }
    ~Counted() override { --liveGenerators; }
};

// A generator that is neither of the two kinds.
class Other : public ITrueOrtho {
  public:
    explicit Other(GeneratorSettings s) : ITrueOrtho(std::move(s)) {}
    GeneratorType GetGeneratorType() const override { return GENERATOR_TORTHO; }
};

enum class Answer { Right, Null, Swapped, Other, Throw };

// Records every call with its arguments and answers each call as told.
class RecordingFactory : public TrueOrthoFactoryImpl {
  public:
    std::vector<std::string> calls;
    std::map<std::string, Answer> answers;  // by call name; Right when absent

    ITrueOrtho* CreateGenerator(GeneratorType type, unsigned int threads) override {
        return Record("CreateGenerator", type, std::to_string(threads));
    }
    ITrueOrtho* CreateCPUGenerator(GeneratorType type, unsigned int threads) override {
        return Record("CreateCPUGenerator", type, std::to_string(threads));
    }
    ITrueOrtho* CreateCudaGenerator(GeneratorType type, const std::vector<int>& devices,
                                    unsigned int threads, unsigned int streams) override {
        std::ostringstream args;
        args << "[";
        for (std::size_t i = 0; i < devices.size(); ++i)
            args << (i ? "," : "") << devices[i];
        args << "], " << threads << ", " << streams;
        return Record("CreateCudaGenerator", type, args.str());
    }
    ITrueOrtho* CreateCudaGenerator(GeneratorType type, unsigned int threads, unsigned int count,
                                    unsigned int streams) override {
        std::ostringstream args;
        args << threads << ", " << count << ", " << streams;
        return Record("CreateCudaGenerator", type, args.str());
    }

  private:
    ITrueOrtho* Record(const std::string& name, GeneratorType type, const std::string& args) {
        calls.push_back(name + "(" + std::to_string(type) + ", " + args + ")");
        const auto it = answers.find(name);
        const bool tortho = type == GENERATOR_TORTHO;
        switch (it == answers.end() ? Answer::Right : it->second) {
            case Answer::Right:
                return tortho ? static_cast<ITrueOrtho*>(new Counted<TorthoGenerator>)
                              : new Counted<OcclusionRecovery>;
            case Answer::Swapped:
                return tortho ? static_cast<ITrueOrtho*>(new Counted<OcclusionRecovery>)
                              : new Counted<TorthoGenerator>;
            case Answer::Other:
                return new Counted<Other>;
            case Answer::Throw:
                KESTREL_THROW(kestrel::IOException, "factory failed");
            case Answer::Null:
                break;
        }
        return nullptr;
    }
};

class ProcessBase : public ::testing::Test {
  protected:
    ProcessBase() : factory(std::make_shared<RecordingFactory>()), scope(factory) {}
    void TearDown() override { EXPECT_EQ(liveGenerators, 0); }

    // Creates a generator of each kind and returns the calls that each made.
    std::vector<std::string> CallsFor(const std::string& procText, GeneratorType type) {
        factory->calls.clear();
        process.SetProc(procText);
        if (type == GENERATOR_TORTHO) {
            std::unique_ptr<TorthoGenerator> g(process.CreateTorthoGenerator());
            EXPECT_TRUE(g);
        } else {
            std::unique_ptr<OcclusionRecovery> g(process.CreateOcclusionRecovery());
            EXPECT_TRUE(g);
        }
        return factory->calls;
    }

    std::shared_ptr<RecordingFactory> factory;
    ScopedTrueOrthoFactoryImpl scope;
    Process process;
};

using Calls = std::vector<std::string>;

void ExpectThrownAt(const kestrel::Exception& e, const std::string& function) {
    EXPECT_NE(e.GetFunction().find(function + "("), std::string::npos) << e.GetFunction();
    EXPECT_EQ(e.GetSourceFile(), "toppfbase.cpp");
    EXPECT_GT(e.GetSourceLine(), 0u);
}

}  // namespace

TEST(ProcessMembers, DefaultsAndMemberwiseCopies) {
    Process a;
    EXPECT_EQ(a.Proc(), "");
    EXPECT_FALSE(*a.GetCancelFlag());
    EXPECT_EQ(a.Values(), (std::vector<int>{0, 1, -1, -1}));

    a.SetProc("CPU:2");
    a.SetValues(5, 6, 7, 8);
    a.SetCancelFlag(true);
    Process b(a);
    Process c;
    c = a;
    for (const Process* p : {&b, &c}) {
        EXPECT_EQ(p->Proc(), "CPU:2");
        EXPECT_EQ(p->Values(), (std::vector<int>{5, 6, 7, 8}));
    }
    c = *&c;
    EXPECT_EQ(c.Proc(), "CPU:2");
    EXPECT_TRUE(*c.GetCancelFlag());
}

TEST(ProcessMembers, CopyHasItsOwnCancelFlag) {
    Process a;
    bool* flag = a.GetCancelFlag();
    EXPECT_EQ(a.GetCancelFlag(), flag);
    *flag = true;  // as whoever was handed the address would
    Process b(a);
    EXPECT_NE(b.GetCancelFlag(), flag);
    EXPECT_TRUE(*b.GetCancelFlag());
    b.SetCancelFlag(false);
    EXPECT_TRUE(*flag);
    *flag = false;
    a.SetCancelFlag(true);
    b = a;
    a.SetCancelFlag(false);
    EXPECT_TRUE(*b.GetCancelFlag());
}

TEST_F(ProcessBase, EachStrategyCallsItsFactoryWithItsArguments) {
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
}

TEST_F(ProcessBase, OtherStrategyValuesUseTheAutomaticChoiceWithoutThreadCount) {
    std::vector<std::string> seen;
    ScopedProcessParametersReader reader([&seen](const std::string& proc, ProcessStrategy& s,
                                                 int& first, int& second, int& third,
                                                 std::vector<int>& list) {
        seen.push_back(proc + (list.empty() ? "" : " (list not empty)"));
        s = static_cast<ProcessStrategy>(5);
        first = 7;
        second = 8;
        third = 9;
        list = {1};
    });
    EXPECT_EQ(CallsFor("X", GENERATOR_TORTHO), Calls{"CreateGenerator(0, 0)"});
    EXPECT_EQ(CallsFor("Y", GENERATOR_OCCLUSION_RECOVERY), Calls{"CreateGenerator(1, 0)"});
    EXPECT_EQ(seen, (std::vector<std::string>{"X", "Y"}));
}

TEST_F(ProcessBase, NullFromGraphicsProcessorFallsBackToCentralProcessor) {
    factory->answers["CreateCudaGenerator"] = Answer::Null;
    EXPECT_EQ(CallsFor("GPU:0;threads=3", GENERATOR_TORTHO),
              (Calls{"CreateCudaGenerator(0, [0], 3, 0)", "CreateCPUGenerator(0, 3)"}));
    EXPECT_EQ(CallsFor("GPU:streams=2;threads=4", GENERATOR_OCCLUSION_RECOVERY),
              (Calls{"CreateCudaGenerator(1, 4, 0, 2)", "CreateCPUGenerator(1, 4)"}));
}

TEST(ProcessBaseBuiltIn, WithoutGraphicsProcessorEveryTextGivesCentralProcessorGenerator) {
    Process process;
    for (const char* text : {"", "AUTO:2", "CPU:2", "GPU:0,1;threads=2", "GPU:threads=2"}) {
        SCOPED_TRACE(text);
        process.SetProc(text);
        std::unique_ptr<TorthoGenerator> g(process.CreateTorthoGenerator());
        ASSERT_TRUE(g);
        EXPECT_EQ(g->GetProcessor(), ProcessorKind::Central);
        EXPECT_EQ(g->GetThreadCount(), text[0] ? 2u : 0u);
    }
    process.SetProc("GPU:5");
    std::unique_ptr<OcclusionRecovery> o(process.CreateOcclusionRecovery());
    EXPECT_EQ(o->GetGeneratorType(), GENERATOR_OCCLUSION_RECOVERY);
}

TEST_F(ProcessBase, NoGeneratorObtainedNamesTheProcText) {
    for (const auto& c :
         {std::make_pair("GPU:1", 2u), std::make_pair("CPU", 1u), std::make_pair("", 1u)}) {
        factory->answers = {{"CreateCudaGenerator", Answer::Null},
                            {"CreateCPUGenerator", Answer::Null},
                            {"CreateGenerator", Answer::Null}};
        factory->calls.clear();
        process.SetProc(c.first);
        try {
            delete process.CreateTorthoGenerator();
            ADD_FAILURE() << "no error for " << c.first;
        } catch (const DataException& e) {
            EXPECT_EQ(std::string(e.what()),
                      std::string("Failed to instantiate an trueortho generator with PROC "
                                  "option set to \"") +
                          c.first + "\"");
            ExpectThrownAt(e, "TOPPFBase::CreateTrueortho");
        }
        EXPECT_EQ(factory->calls.size(), c.second) << c.first;
    }
}

TEST_F(ProcessBase, GeneratorOfWrongKindIsReleasedAndRefused) {
    process.SetProc("CPU:1");
    for (Answer answer : {Answer::Swapped, Answer::Other}) {
        factory->answers["CreateCPUGenerator"] = answer;
        try {
            delete process.CreateTorthoGenerator();
            ADD_FAILURE();
        } catch (const DataException& e) {
            EXPECT_STREQ(e.what(), "The trueortho generator is not of the expected type");
            ExpectThrownAt(e, "TOPPFBase::CreateTorthoGenerator");
        }
        try {
            delete process.CreateOcclusionRecovery();
            ADD_FAILURE();
        } catch (const DataException& e) {
            EXPECT_STREQ(e.what(), "The trueortho generator is not of the expected type");
            ExpectThrownAt(e, "TOPPFBase::CreateOcclusionRecovery");
        }
        EXPECT_EQ(liveGenerators, 0);
    }
}

TEST_F(ProcessBase, ErrorsOfReaderAndFactoryPassOutUnchanged) {
    process.SetProc("GPU:x");
    try {
        delete process.CreateTorthoGenerator();
        ADD_FAILURE();
    } catch (const DataException& e) {
        EXPECT_NE(e.GetFunction().find("GetProcessParameters("), std::string::npos);
    }
    EXPECT_TRUE(factory->calls.empty());

    // A throw from the fallback, after the graphics-processor call gave null.
    factory->answers = {{"CreateCudaGenerator", Answer::Null},
                        {"CreateCPUGenerator", Answer::Throw}};
    process.SetProc("GPU:0");
    EXPECT_THROW(delete process.CreateOcclusionRecovery(), kestrel::IOException);
}

TEST_F(ProcessBase, ProcTextIsReadAfreshOnEveryCall) {
    std::unique_ptr<ITrueOrtho> a, b;
    process.SetProc("CPU:1");
    a.reset(process.CreateTrueortho(GENERATOR_TORTHO));
    process.SetProc("CPU:2");
    b.reset(process.CreateTrueortho(GENERATOR_TORTHO));
    EXPECT_EQ(factory->calls, (Calls{"CreateCPUGenerator(0, 1)", "CreateCPUGenerator(0, 2)"}));
    EXPECT_NE(a.get(), b.get());
}
