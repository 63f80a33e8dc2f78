#pragma once
// Installs a fake of every process-wide platform service for the lifetime of a test
// fixture, and restores whatever was installed before.

#include "Statistics/MxReportingVocabulary.h"
#include "fakes/CapturingLogSink.h"
#include "fakes/FakeDispatch.h"
#include "fakes/FakeServices.h"
#include "fakes/FakeUplink.h"

namespace mx::testing {

class FakePlatform {
public:
    FakePlatform() { MxReportingResetInternalBuildForTesting(); }
    ~FakePlatform()
    {
        // Work still queued holds sessions; they must go while the fakes they log and
        // trace through are still installed.
        dispatch.discardAll();
        // Registrations left behind hold their sessions too.
        orientation.clear();
        MxReportingResetInternalBuildForTesting();
    }

    EffectJournal journal;
    CapturingLogSink log;
    RecordingTracePoints trace{journal};
    FakeTally tally{journal};
    FakeJoule joule{journal};
    FakeUplink uplink;
    FakeDeviceProperties device;
    FakeOrientation orientation{journal};
    FakeDispatch dispatch;
    FakeFileSystem files;

private:
    ScopedInstall<MxLogSink> installLog_{log};
    ScopedInstall<TracePoints> installTrace_{trace};
    ScopedInstall<Tally> installTally_{tally};
    ScopedInstall<Joule> installJoule_{joule};
    ScopedInstall<Uplink> installUplink_{uplink};
    ScopedInstall<DeviceProperties> installDevice_{device};
    ScopedInstall<Orientation> installOrientation_{orientation};
    ScopedInstall<Dispatch> installDispatch_{dispatch};
    ScopedInstall<FileSystem> installFiles_{files};
};

} // namespace mx::testing
