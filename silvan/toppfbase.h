// The base class of the true-ortho processes: generator creation from the PROC option, and the
// cancel flag.
#pragma once

#include <string>

#include <kestrel/exception.h>
#include <kestrel/processparams.h>
#include <kestrel/trueortho.h>
#include <silvan/export.h>

namespace kestrel {
namespace processes {
namespace silvan {

class SILVAN_API TOPPFBase {
  public:
    TOPPFBase();
    TOPPFBase(const TOPPFBase&);
    TOPPFBase& operator=(const TOPPFBase&);
    virtual ~TOPPFBase();

    // The process's work; supplied by each derived process and never called by this library.
    virtual void Execute() = 0;

    // The text of the process's PROC option, read afresh by every generator creation.
    void SetProc(const std::string& proc);

    // The address of the cancel flag, valid for the object's life, to be handed to whatever may
    // stop the run. The flag is a plain bool: a process that sets it from another thread while
    // a generator reads it must order those accesses itself (or keep a std::atomic<bool>, which
    // has the same size, behind the same address).
    bool* GetCancelFlag();
    void SetCancelFlag(bool cancel);

    // A new true-ortho generator made as the PROC text says; the caller owns it. Throws
    // DataException when none can be made or the one made is of another kind.
    kestrel::processes::TorthoGenerator* CreateTorthoGenerator();
    // A new occlusion-recovery generator; as CreateTorthoGenerator.
    kestrel::processes::OcclusionRecovery* CreateOcclusionRecovery();

  protected:
    // A new generator of the given kind made as the PROC text says, falling back to the central
    // processor when a graphics processor was asked for and none could be used. The caller owns
    // it. Throws DataException when no generator is obtained.
    kestrel::processes::ITrueOrtho* CreateTrueortho(kestrel::processes::GeneratorType type);

    std::string proc;
    bool cancelFlag;
    // Values kept for the derived processes; this class only gives them their defaults and
    // copies them.
    int processValue1;
    int processValue2;
    int processValue3;
    int processValue4;
};

}  // namespace silvan
}  // namespace processes
}  // namespace kestrel
