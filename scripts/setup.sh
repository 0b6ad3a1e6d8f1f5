#!/usr/bin/env bash
# Installs every Debian package that building, testing and the demo need (Debian 12, as root).
# Packages already installed are not asked for again, so running it twice is quick.
set -euo pipefail

packages=(
  build-essential python3 pkg-config cmake git clang-format clang-tidy
  libgtest-dev libgmock-dev googletest
  libavformat-dev libavcodec-dev libavdevice-dev libavutil-dev libswscale-dev libswresample-dev
  libxcb1-dev libxcb-shm0-dev libxcb-damage0-dev libxcb-xfixes0-dev libxcb-randr0-dev libxcb-render0-dev
  libpulse-dev libdbus-1-dev
  xvfb x11-xserver-utils xdotool pulseaudio pulseaudio-utils pipewire-pulse wireplumber dbus-daemon ffmpeg sox
  gstreamer1.0-tools gstreamer1.0-plugins-base gstreamer1.0-plugins-good gstreamer1.0-libav
  gstreamer1.0-plugins-base-apps mediainfo libfaketime
  g++-mingw-w64-x86-64-posix mingw-w64-x86-64-dev
  chromium
  wine wine64
)
# A machine without Node gets Debian's, with its headers and node-gyp.
command -v node >/dev/null 2>&1 || packages+=(nodejs npm node-gyp libnode-dev)

missing=()
for package in "${packages[@]}"; do
  dpkg-query -W -f='${Status}' "$package" 2>/dev/null | grep -q 'install ok installed' || missing+=("$package")
done
if [ ${#missing[@]} -gt 0 ]; then
  sudo=""
  [ "$(id -u)" = 0 ] || sudo=sudo
  export DEBIAN_FRONTEND=noninteractive
  $sudo apt-get update
  $sudo apt-get install -y --no-install-recommends "${missing[@]}"
fi
echo "setup: all packages present"
