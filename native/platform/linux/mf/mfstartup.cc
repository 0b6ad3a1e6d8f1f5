// MFStartup and MFShutdown on Linux. The only start-up work is routing FFmpeg's log; it keeps the
// count Media Foundation keeps, so unpaired calls show up as they would on Windows: MFShutdown
// without a start-up still outstanding fails with MF_E_PLATFORM_NOT_INITIALIZED (the code
// Windows gives for work on a platform that is not started) and leaves the count at zero, and
// the sink writer refuses to be created while the count is zero.
#include <atomic>

#include "platform/linux/ffmpeg/avlog.h"
#include "platform/linux/mf.h"
#include "platform/linux/mf/mfstartup.h"

namespace {

std::atomic<int> startups{0};

}  // namespace

HRESULT MFStartup(ULONG version, DWORD) {
  // Both SDK generations (1 and 2) of API version 0x70 are accepted, as by Windows.
  const ULONG sdk = version >> 16;
  if ((version & 0xFFFF) != MF_API_VERSION || (sdk != 1 && sdk != MF_SDK_VERSION)) return MF_E_BAD_STARTUP_VERSION;
  // Every user of FFmpeg here starts the platform first, so its log is routed before it logs.
  platform::ffmpeg::routeLog();
  ++startups;
  return S_OK;
}

HRESULT MFShutdown() {
  int count = startups.load();
  do {
    if (count <= 0) return MF_E_PLATFORM_NOT_INITIALIZED;
  } while (!startups.compare_exchange_weak(count, count - 1));
  return S_OK;
}

namespace platform {

bool mediaFoundationStarted() { return startups.load() > 0; }

}  // namespace platform
