// Linux declarations of the Kernel32 subset: events on a mutex and a condition variable, power
// requests as a logind idle inhibitor, debugger output to standard error (kernel32.cc).
#pragma once

#include "platform/linux/com.h"

struct SECURITY_ATTRIBUTES {
  DWORD nLength;
  LPVOID lpSecurityDescriptor;
  BOOL bInheritHandle;
};
using LPSECURITY_ATTRIBUTES = SECURITY_ATTRIBUTES*;

inline HANDLE const INVALID_HANDLE_VALUE = reinterpret_cast<HANDLE>(static_cast<intptr_t>(-1));

constexpr DWORD WAIT_OBJECT_0 = 0;
constexpr DWORD WAIT_TIMEOUT = 258;
constexpr DWORD WAIT_FAILED = 0xFFFFFFFFu;

// The monotonic clock in 100 ns units, as loopback packets are stamped.
BOOL QueryPerformanceCounter(LARGE_INTEGER* count);
BOOL QueryPerformanceFrequency(LARGE_INTEGER* frequency);

HANDLE CreateEventA(LPSECURITY_ATTRIBUTES attributes, BOOL manualReset, BOOL initialState, LPCSTR name);
BOOL SetEvent(HANDLE event);
BOOL ResetEvent(HANDLE event);
DWORD WaitForSingleObject(HANDLE handle, DWORD milliseconds);
BOOL CloseHandle(HANDLE handle);

constexpr ULONG POWER_REQUEST_CONTEXT_VERSION = 0;
constexpr DWORD POWER_REQUEST_CONTEXT_SIMPLE_STRING = 0x1;

struct REASON_CONTEXT {
  ULONG Version;
  DWORD Flags;
  union {
    struct {
      HMODULE LocalizedReasonModule;
      ULONG LocalizedReasonId;
      ULONG ReasonStringCount;
      LPWSTR* ReasonStrings;
    } Detailed;
    LPWSTR SimpleReasonString;
  } Reason;
};
using PREASON_CONTEXT = REASON_CONTEXT*;

enum POWER_REQUEST_TYPE {
  PowerRequestDisplayRequired,
  PowerRequestSystemRequired,
  PowerRequestAwayModeRequired,
  PowerRequestExecutionRequired,
};

HANDLE PowerCreateRequest(PREASON_CONTEXT context);
BOOL PowerSetRequest(HANDLE request, POWER_REQUEST_TYPE type);
BOOL PowerClearRequest(HANDLE request, POWER_REQUEST_TYPE type);

void OutputDebugStringW(LPCWSTR text);

// The extension of the last path component, its '.' included; the terminator when there is none.
LPWSTR PathFindExtensionW(LPCWSTR path);
