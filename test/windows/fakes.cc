// Every fake builds against the real SDK interfaces, also those no test linked here uses yet.
#include "fakes/audio.h"
#include "fakes/captureengine.h"
#include "fakes/dxgi.h"

#include <initguid.h>

// The fake endpoint answers IMMDevice by name; the capture code never asks for it, so neither the
// import libraries nor native/platform/windows define it.
DEFINE_GUID(IID_IMMDevice, 0xd666063f, 0x1587, 0x4e43, 0x81, 0xf1, 0xb9, 0x48, 0xe8, 0x07, 0x36, 0x3f);
