// Diagnostic lines on standard output, and two console aids.
#pragma once

#include <cstdint>
#include <string>

namespace capture {

// "<ms since 1970>: Warning: <text>"; a missing text prints as "unknown exception".
void logWarning(const char* text);
// "<ms since 1970>: Testing: <text>".
void logTesting(const char* text);
// Prompts "Press ENTER to continue... " and discards standard input up to the next newline.
void waitForEnter();
// "temp-" + index padded with zeros to four digits + suffix.
std::string tempFileName(int32_t index, const std::string& suffix);

}  // namespace capture
