// FFmpeg's log inside the add-on: its libraries print to standard error by default, outside the
// add-on's warning form. Routed once, on the platform's start-up.
#pragma once

namespace platform::ffmpeg {

// Installs the add-on's log callback (once per process; later calls do nothing). Errors that
// FFmpeg reports become warning lines; everything less severe is dropped.
void routeLog();

}  // namespace platform::ffmpeg
