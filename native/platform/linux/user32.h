// Linux declarations of the User32 subset: monitors come from RandR (monitor.cc), messages
// go to X11 windows (user32.cc). A window handle is the X window id.
#pragma once

#include "platform/linux/com.h"

constexpr UINT WM_COMMAND = 0x0111;
constexpr UINT WM_APP = 0x8000;
constexpr DWORD ENUM_CURRENT_SETTINGS = 0xFFFFFFFFu;
constexpr DWORD CCHDEVICENAME = 32;
constexpr DWORD CCHFORMNAME = 32;

struct POINT {
  LONG x;
  LONG y;
};
struct POINTL {
  LONG x;
  LONG y;
};
struct RECT {
  LONG left;
  LONG top;
  LONG right;
  LONG bottom;
};

struct MONITORINFO {
  DWORD cbSize;
  RECT rcMonitor;
  RECT rcWork;
  DWORD dwFlags;
};
struct MONITORINFOEXA : MONITORINFO {
  CHAR szDevice[CCHDEVICENAME];
};
static_assert(sizeof(MONITORINFOEXA) == 72, "MONITORINFOEXA keeps its Windows size");

struct DISPLAY_DEVICEA {
  DWORD cb;
  CHAR DeviceName[32];
  CHAR DeviceString[128];
  DWORD StateFlags;
  CHAR DeviceID[128];
  CHAR DeviceKey[128];
};
static_assert(sizeof(DISPLAY_DEVICEA) == 424, "DISPLAY_DEVICEA keeps its Windows size");

#pragma pack(push, 2)
struct DEVMODEA {
  BYTE dmDeviceName[CCHDEVICENAME];
  WORD dmSpecVersion;
  WORD dmDriverVersion;
  WORD dmSize;
  WORD dmDriverExtra;
  DWORD dmFields;
  POINTL dmPosition;  // the display-device arm of the union
  DWORD dmDisplayOrientation;
  DWORD dmDisplayFixedOutput;
  SHORT dmColor;
  SHORT dmDuplex;
  SHORT dmYResolution;
  SHORT dmTTOption;
  SHORT dmCollate;
  BYTE dmFormName[CCHFORMNAME];
  WORD dmLogPixels;
  DWORD dmBitsPerPel;
  DWORD dmPelsWidth;
  DWORD dmPelsHeight;
  DWORD dmDisplayFlags;
  DWORD dmDisplayFrequency;
  DWORD dmICMMethod;
  DWORD dmICMIntent;
  DWORD dmMediaType;
  DWORD dmDitherType;
  DWORD dmReserved1;
  DWORD dmReserved2;
  DWORD dmPanningWidth;
  DWORD dmPanningHeight;
};
#pragma pack(pop)
static_assert(sizeof(DEVMODEA) == 156, "DEVMODEA keeps its Windows size");

// Monitors (monitor.cc). An HMONITOR names a RandR monitor of the display in $DISPLAY.
BOOL GetMonitorInfoA(HMONITOR monitor, MONITORINFO* info);
BOOL EnumDisplayDevicesA(LPCSTR device, DWORD index, DISPLAY_DEVICEA* displayDevice, DWORD flags);
BOOL EnumDisplaySettingsA(LPCSTR device, DWORD mode, DEVMODEA* devMode);

// Windows (user32.cc).
BOOL PostMessageA(HWND window, UINT message, WPARAM wParam, LPARAM lParam);
BOOL SetForegroundWindow(HWND window);
