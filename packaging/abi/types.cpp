// The types of the library's headers, each in a place where the compiler has to describe it. A type
// that is added to a header is added here.
#include "ZEL/channel.h"
#include "ZEL/ipc.h"
#include "ZEL/is_syncedshare.h"
#include "ZEL/log.h"
#include "ZEL/pobject.h"
#include "ZEL/rsyncer.h"
#include "ZEL/stream.h"
#include "ZEL/sync_obj.h"
#include "ZEL/zel.h"

extern "C" __attribute__((visibility("default"))) void PublicTypes(
    ZEL::Channel*, ZEL::ChannelOps*, ZEL::ResultCode*,      // channel.h
    ZEL::IPCListener*, ZEL::IPCSender*,                     // ipc.h
    ZELPairResult*, zel_svr_status*,                        // is_syncedshare.h
    ZEL::Logger*,                                           // log.h
    ZEL::PObject*,                                          // pobject.h
    ZEL::Rsyncer*, ZEL::Rsyncer::RsyncTask*,                // rsyncer.h
    ZEL::PStream*,                                          // stream.h
    ZEL::SCHD_MODE*, ZEL::TASK_STATUS*, ZEL::TASK_RESULT*,  // sync_obj.h
    ZEL::EVENT_STATUS*, ZEL::Share*, ZEL::SyncInfo*, ZEL::Schedule*, ZEL::TaskInfo*, ZEL::SyncTask*,
    ZEL::Event*, ZEL::ShareInfo*, ZEL::VolumeInfo*, ZEL::SimpleFileLock*,  // zel.h
    ZEL::LockFactory*) {}
