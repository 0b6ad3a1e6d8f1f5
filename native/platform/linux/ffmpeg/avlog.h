// FFmpeg's log inside the add-on: its libraries print to standard error by default, outside the
// add-on's warning form. Routed once, on the platform's start-up.
#pragma once

namespace platform::ffmpeg {

// Installs the add-on's log callback (once per process; later calls do nothing). Errors that
// FFmpeg reports become warning lines; everything less severe is dropped.
void routeLog();

// While one lives on a thread, FFmpeg's messages from that thread are dropped: for an attempt
// whose failure is expected and answered by another one.
class QuietLog {
 public:
  QuietLog();
  ~QuietLog();
  QuietLog(const QuietLog&) = delete;
  QuietLog& operator=(const QuietLog&) = delete;
};

}  // namespace platform::ffmpeg
