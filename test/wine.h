// Whether the tests run under Wine, which lacks some of what Windows does (a few system message
// texts, parts of Media Foundation). Tests skip those checks there only, saying why.
#pragma once

#ifdef _WIN32
#include <windows.h>
#endif

namespace testsupport {

inline bool underWine() {
#ifdef _WIN32
  // Only Wine's ntdll exports its version.
  HMODULE ntdll = GetModuleHandleA("ntdll.dll");
  return ntdll && GetProcAddress(ntdll, "wine_get_version");
#else
  return false;
#endif
}

}  // namespace testsupport
