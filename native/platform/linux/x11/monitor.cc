// User32's monitor functions over RandR: "\\.\DISPLAYn" is the n-th monitor counted over the
// screens of $DISPLAY, and its one attached monitor device is described by EDID or RandR name.
#include <algorithm>
#include <cstring>

#include "platform/linux/x11/display.h"
#include "platform/linux/user32.h"

namespace {

constexpr DWORD MONITORINFOF_PRIMARY = 0x1;
constexpr DWORD DISPLAY_DEVICE_ATTACHED_TO_DESKTOP = 0x1;
constexpr DWORD DISPLAY_DEVICE_MONITOR_ACTIVE = 0x1;
constexpr DWORD DISPLAY_DEVICE_MONITOR_ATTACHED = 0x2;
constexpr DWORD DISPLAY_DEVICE_PRIMARY_DEVICE = 0x4;
constexpr DWORD DM_POSITION = 0x20;
constexpr DWORD DM_BITSPERPEL = 0x40000;
constexpr DWORD DM_PELSWIDTH = 0x80000;
constexpr DWORD DM_PELSHEIGHT = 0x100000;
constexpr DWORD DM_DISPLAYFREQUENCY = 0x400000;

template <size_t N>
void copyText(CHAR (&to)[N], const std::string& from) {
  size_t n = std::min(from.size(), N - 1);
  std::memcpy(to, from.data(), n);
  to[n] = '\0';
}

struct Found {
  platform::x11::Connection connection;
  int screen = 0;
  platform::x11::Monitor monitor;
  int number = 0;
};

bool findByDevice(LPCSTR device, Found* found) {
  found->number = platform::x11::parseDisplayDeviceName(device);
  if (found->number == 0) return false;
  found->connection = platform::x11::connect(platform::x11::displayName());
  return found->connection &&
         platform::x11::monitorByNumber(found->connection.get(), found->number, &found->screen, &found->monitor);
}

}  // namespace

BOOL GetMonitorInfoA(HMONITOR monitor, MONITORINFO* info) {
  int screen = 0;
  xcb_atom_t name = 0;
  if (!info || (info->cbSize != sizeof(MONITORINFO) && info->cbSize != sizeof(MONITORINFOEXA)) ||
      !platform::x11::decodeMonitorHandle(monitor, &screen, &name)) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return FALSE;
  }
  auto connection = platform::x11::connect(platform::x11::displayName());
  platform::x11::Monitor m;
  if (!connection || !platform::x11::findMonitor(connection.get(), screen, name, &m)) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return FALSE;
  }
  info->rcMonitor = {m.x, m.y, m.x + m.width, m.y + m.height};
  info->rcWork = info->rcMonitor;
  info->dwFlags = m.primary ? MONITORINFOF_PRIMARY : 0;
  if (info->cbSize == sizeof(MONITORINFOEXA)) {
    copyText(static_cast<MONITORINFOEXA*>(info)->szDevice,
             platform::x11::displayDeviceName(platform::x11::displayNumber(connection.get(), screen, name)));
  }
  return TRUE;
}

BOOL EnumDisplayDevicesA(LPCSTR device, DWORD index, DISPLAY_DEVICEA* displayDevice, DWORD flags) {
  if (!displayDevice || displayDevice->cb < sizeof(DISPLAY_DEVICEA)) return FALSE;
  DWORD cb = displayDevice->cb;
  Found found;
  if (!device) {
    // The display devices themselves: one per monitor.
    std::string name = platform::x11::displayDeviceName(static_cast<int>(index) + 1);
    if (!findByDevice(name.c_str(), &found)) return FALSE;
    std::memset(displayDevice, 0, sizeof(DISPLAY_DEVICEA));
    displayDevice->cb = cb;
    copyText(displayDevice->DeviceName, name);
    copyText(displayDevice->DeviceString, "X11 screen " + std::to_string(found.screen));
    displayDevice->StateFlags =
        DISPLAY_DEVICE_ATTACHED_TO_DESKTOP | (found.monitor.primary ? DISPLAY_DEVICE_PRIMARY_DEVICE : 0);
    return TRUE;
  }
  if (index != 0 || !findByDevice(device, &found)) return FALSE;
  std::memset(displayDevice, 0, sizeof(DISPLAY_DEVICEA));
  displayDevice->cb = cb;
  copyText(displayDevice->DeviceName, std::string(device) + "\\Monitor0");
  copyText(displayDevice->DeviceString, platform::x11::describe(found.connection.get(), found.monitor));
  displayDevice->StateFlags = DISPLAY_DEVICE_MONITOR_ACTIVE | DISPLAY_DEVICE_MONITOR_ATTACHED;
  return TRUE;
}

BOOL EnumDisplaySettingsA(LPCSTR device, DWORD mode, DEVMODEA* devMode) {
  Found found;
  if (!devMode || mode != ENUM_CURRENT_SETTINGS || !findByDevice(device, &found)) return FALSE;
  WORD driverExtra = devMode->dmDriverExtra;
  std::memset(devMode, 0, sizeof(DEVMODEA));
  std::string name = "\\\\.\\DISPLAY" + std::to_string(found.number);
  std::memcpy(devMode->dmDeviceName, name.data(), std::min<size_t>(name.size(), CCHDEVICENAME - 1));
  devMode->dmSpecVersion = 0x0401;
  devMode->dmSize = sizeof(DEVMODEA);
  devMode->dmDriverExtra = driverExtra;
  devMode->dmFields = DM_POSITION | DM_BITSPERPEL | DM_PELSWIDTH | DM_PELSHEIGHT | DM_DISPLAYFREQUENCY;
  devMode->dmPosition = {found.monitor.x, found.monitor.y};
  devMode->dmBitsPerPel = 32;
  devMode->dmPelsWidth = found.monitor.width;
  devMode->dmPelsHeight = found.monitor.height;
  devMode->dmDisplayFrequency = 60;  // X does not give a virtual monitor a refresh rate
  return TRUE;
}
