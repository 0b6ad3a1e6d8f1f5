// UTF-16 (wide) and UTF-8 conversions for device names and file names.
#pragma once

#include <string>

namespace capture {

std::string toUtf8(const std::wstring& text);
std::wstring toWide(const std::string& text);

}  // namespace capture
