#include "platform/linux/com/classes.h"

#include "platform/linux/mfcapture.h"
#include "platform/linux/wasapi.h"

namespace platform {

namespace {

// One row per class a family provides (see the family's header for its factory).
const ClassEntry classes[] = {
    {CLSID_MMDeviceEnumerator, wasapi::createDeviceEnumerator},
    {CLSID_MFCaptureEngineClassFactory, createCaptureEngineClassFactory},
};

}  // namespace

const ClassEntry* findClass(REFCLSID clsid) {
  for (const ClassEntry& entry : classes)
    if (entry.clsid == clsid) return &entry;
  return nullptr;
}

}  // namespace platform
