// The true-ortho generator library: generator objects and the factory that makes them.
#pragma once

#include <memory>
#include <vector>

#include <kestrel/export.h>

namespace kestrel {
namespace processes {

// The kind of generator asked for. The underlying type is fixed so that an out-of-range value
// can be held and refused.
enum GeneratorType : int {
    GENERATOR_TORTHO = 0,             // a TorthoGenerator
    GENERATOR_OCCLUSION_RECOVERY = 1  // an OcclusionRecovery
};

enum class ProcessorKind { Central, Graphics };

// What a generator was created with.
struct GeneratorSettings {
    ProcessorKind processor = ProcessorKind::Central;
    // Central-processor threads; 0 lets the generator choose.
    unsigned int threadCount = 0;
    // Graphics processors by number; empty when they were chosen by count.
    std::vector<int> devices;
    // Graphics processors to use when none are listed; 0 for every usable one.
    unsigned int deviceCount = 0;
    // Work streams per graphics processor; 0 lets the generator choose.
    unsigned int streamCount = 0;
};

// Every generator. Generators are made by TrueOrthoFactory and owned by the caller.
class KESTREL_API ITrueOrtho {
  public:
    virtual ~ITrueOrtho();
    ITrueOrtho(const ITrueOrtho&) = delete;
    ITrueOrtho& operator=(const ITrueOrtho&) = delete;

    virtual GeneratorType GetGeneratorType() const = 0;

    GeneratorSettings GetSettings() const { return settings_; }
    ProcessorKind GetProcessor() const { return settings_.processor; }
    unsigned int GetThreadCount() const { return settings_.threadCount; }
    std::vector<int> GetDevices() const { return settings_.devices; }
    unsigned int GetDeviceCount() const { return settings_.deviceCount; }
    unsigned int GetStreamCount() const { return settings_.streamCount; }

  protected:
    explicit ITrueOrtho(GeneratorSettings settings);

  private:
    GeneratorSettings settings_;
};

class KESTREL_API TorthoGenerator : public ITrueOrtho {
  public:
    explicit TorthoGenerator(GeneratorSettings settings = GeneratorSettings());
    ~TorthoGenerator() override;
    GeneratorType GetGeneratorType() const override { return GENERATOR_TORTHO; }
};

class KESTREL_API OcclusionRecovery : public ITrueOrtho {
  public:
    explicit OcclusionRecovery(GeneratorSettings settings = GeneratorSettings());
    ~OcclusionRecovery() override;
    GeneratorType GetGeneratorType() const override { return GENERATOR_OCCLUSION_RECOVERY; }
};

// The four ways of making a generator. Each returns a new object owned by the caller, or null
// when it cannot make one; each throws DataException for a GeneratorType other than 0 and 1.
class KESTREL_API TrueOrthoFactoryImpl {
  public:
    virtual ~TrueOrthoFactoryImpl();

    // A generator on the best processor present: a usable graphics processor, otherwise the
    // central processor with threadCount threads.
    virtual ITrueOrtho* CreateGenerator(GeneratorType type, unsigned int threadCount) = 0;
    virtual ITrueOrtho* CreateCPUGenerator(GeneratorType type, unsigned int threadCount) = 0;
    // On the listed graphics processors.
    virtual ITrueOrtho* CreateCudaGenerator(GeneratorType type, const std::vector<int>& devices,
                                            unsigned int threadCount, unsigned int streamCount) = 0;
    // On deviceCount usable graphics processors (0: every usable one).
    virtual ITrueOrtho* CreateCudaGenerator(GeneratorType type, unsigned int threadCount,
                                            unsigned int deviceCount, unsigned int streamCount) = 0;

  protected:
    TrueOrthoFactoryImpl() = default;
    TrueOrthoFactoryImpl(const TrueOrthoFactoryImpl&) = default;
    TrueOrthoFactoryImpl& operator=(const TrueOrthoFactoryImpl&) = default;
};

// The factory the processes call. Its calls go to the installed implementation, which is the
// built-in one unless a test has installed another.
//
// The built-in implementation has no graphics-processor support: it finds no usable graphics
// processor, so the graphics-processor calls return null and CreateGenerator makes a
// central-processor generator.
class KESTREL_API TrueOrthoFactory {
  public:
    static ITrueOrtho* CreateGenerator(GeneratorType type, unsigned int threadCount);
    static ITrueOrtho* CreateCPUGenerator(GeneratorType type, unsigned int threadCount);
    static ITrueOrtho* CreateCudaGenerator(GeneratorType type, const std::vector<int>& devices,
                                           unsigned int threadCount, unsigned int streamCount);
    static ITrueOrtho* CreateCudaGenerator(GeneratorType type, unsigned int threadCount,
                                           unsigned int deviceCount, unsigned int streamCount);

    // The built-in implementation, for an installed one that passes some calls on.
    static std::shared_ptr<TrueOrthoFactoryImpl> GetDefaultImplementation();
    // Installs impl (null restores the built-in one) and returns the one it replaces. Not meant
    // to be called while another thread creates a generator.
    static std::shared_ptr<TrueOrthoFactoryImpl> SetImplementation(
        std::shared_ptr<TrueOrthoFactoryImpl> impl);
};

// Installs a factory implementation for its own lifetime and restores the previous one after.
class KESTREL_API ScopedTrueOrthoFactoryImpl {
  public:
    explicit ScopedTrueOrthoFactoryImpl(std::shared_ptr<TrueOrthoFactoryImpl> impl);
    ~ScopedTrueOrthoFactoryImpl();
    ScopedTrueOrthoFactoryImpl(const ScopedTrueOrthoFactoryImpl&) = delete;
    ScopedTrueOrthoFactoryImpl& operator=(const ScopedTrueOrthoFactoryImpl&) = delete;

  private:
    std::shared_ptr<TrueOrthoFactoryImpl> previous_;
};

}  // namespace processes
}  // namespace kestrel
