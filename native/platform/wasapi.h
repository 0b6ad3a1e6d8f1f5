// Multimedia Device API and WASAPI: endpoint enumeration, property store, audio client, capture
// and render clients.
#pragma once

#include "platform/com.h"

#ifdef _WIN32
// The Media Foundation headers must come before the audio ones, or ksmedia and strmif clash.
#include "platform/mf.h"
#include <mfcaptureengine.h>
#include <mmdeviceapi.h>
#include <audioclient.h>
// Defines PKEY_Device_FriendlyName here rather than needing a library that carries it.
#include <initguid.h>
#include <functiondiscoverykeys_devpkey.h>
#else
#include "platform/linux/wasapi.h"
#endif
