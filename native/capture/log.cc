#include "capture/log.h"

#include <iomanip>
#include <iostream>
#include <limits>
#include <mutex>
#include <sstream>

#include "capture/clock.h"

namespace capture {

namespace {

// Threads that fail together (an endpoint's capture and silence threads when its sink goes) must
// not interleave their lines.
void logLine(const char* label, const char* text) {
  std::ostringstream line;
  line << currentTimeMillis() << label << (text ? text : "unknown exception") << '\n';
  static std::mutex writing;
  std::lock_guard<std::mutex> hold(writing);
  std::cout << line.str() << std::flush;
}

}  // namespace

void logWarning(const char* text) { logLine(": Warning: ", text); }

void logTesting(const char* text) { logLine(": Testing: ", text); }

void waitForEnter() {
  std::cout << "Press ENTER to continue... ";
  std::cin.ignore(std::numeric_limits<std::streamsize>::max(), '\n');
}

std::string tempFileName(int32_t index, std::string suffix) {
  std::ostringstream name;
  name << "temp-" << std::setfill('0') << std::setw(4) << index << suffix;
  return name.str();
}

}  // namespace capture
