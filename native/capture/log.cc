#include "capture/log.h"

#include <iomanip>
#include <iostream>
#include <limits>
#include <sstream>

#include "capture/clock.h"

namespace capture {

namespace {

void logLine(const char* label, const char* text) {
  std::cout << currentTimeMillis() << label << (text ? text : "unknown exception") << std::endl;
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
