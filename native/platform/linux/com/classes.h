// The classes that CoCreateInstance can make on Linux, in place of the registry of Windows.
#pragma once

#include "platform/linux/com.h"

namespace platform {

struct ClassEntry {
  const GUID& clsid;
  HRESULT (*create)(REFIID riid, void** object);
};

// Looks a class up in the table of classes.cc; null when the class is not provided.
const ClassEntry* findClass(REFCLSID clsid);

}  // namespace platform
