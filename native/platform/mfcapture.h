// Media Foundation capture: the capture engine with its source and sinks, capture-device
// enumeration and activation objects, the DXGI device manager, the transcode type query.
#pragma once

#include "platform/com.h"

#ifdef _WIN32
#include "platform/mf.h"
#include <mfcaptureengine.h>
#else
#include "platform/linux/mfcapture.h"
#endif
