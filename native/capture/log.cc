#include "capture/log.h"

#include <iomanip>
#include <iostream>
#include <limits>
#include <sstream>

#include "capture/clock.h"

namespace capture {

namespace {

// Threads that fail together (an endpoint's capture and silence threads when its sink goes) must
// not interleave their lines: the line is made first and written in one insertion, which the
// standard stream hands to stdio as one locked write.
void logLine(const char* label, const char* text) {
  std::ostringstream line;
  line << currentTimeMillis() << label << (text ? text : "unknown exception") << '\n';
  std::cout << line.str() << std::flush;
}

}  // namespace

void logWarning(const char* text) { logLine(": Warning: ", text); }

void logTesting(const char* text) { logLine(": Testing: ", text); }

void waitForEnter() {
  std::cout << "Press ENTER to continue... ";
  std::cin.ignore(std::numeric_limits<std::streamsize>::max(), '\n');
}

std::string tempFileName(int32_t index, const std::string& suffix) {
  std::ostringstream name;
  name << "temp-" << std::setfill('0') << std::setw(4) << index << suffix;
  return name.str();
}

}  // namespace capture
