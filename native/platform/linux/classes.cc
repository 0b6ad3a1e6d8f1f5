#include "platform/linux/classes.h"

#include <iterator>

#include "platform/linux/mfcapture.h"
#include "platform/linux/wasapi.h"

namespace platform {

namespace {

// Placeholder row: keeps the table valid while no family registers a class.
HRESULT noClass(REFIID, void** object) {
  if (object) *object = nullptr;
  return REGDB_E_CLASSNOTREG;
}

// One row per class a family provides (see the family's header for its factory).
const ClassEntry classes[] = {
    {GUID_NULL, noClass},
    {CLSID_MMDeviceEnumerator, wasapi::createDeviceEnumerator},
    {CLSID_MFCaptureEngineClassFactory, createCaptureEngineClassFactory},
};

}  // namespace

const ClassEntry* findClass(REFCLSID clsid) {
  for (const ClassEntry& entry : classes)
    if (entry.clsid == clsid && entry.clsid != GUID_NULL) return &entry;
  return nullptr;
}

}  // namespace platform
