// Media Foundation: start-up, attributes, media types, buffers, samples, collections, activation
// objects, events, the sink writer, and the GUIDs and codes the capture code uses.
#pragma once

#include "platform/com.h"

#ifdef _WIN32
// The Media Foundation headers come before anything that pulls in ksmedia.h (see wave.h).
#include <mfapi.h>
#include <mfidl.h>
#include <mfreadwrite.h>
#include <mferror.h>
#include <codecapi.h>
#include "platform/wave.h"
#else
#include "platform/linux/mf.h"
#endif
