#include "capture/text.h"

#include <codecvt>
#include <locale>

namespace capture {

// codecvt_utf8_utf16 is deprecated but does exactly this on both platforms: on Linux, where
// wchar_t is 32-bit, each element still holds one UTF-16 code unit.
using Converter = std::wstring_convert<std::codecvt_utf8_utf16<wchar_t>, wchar_t>;

std::string toUtf8(const std::wstring& text) { return Converter().to_bytes(text); }

std::wstring toWide(const std::string& text) { return Converter().from_bytes(text); }

}  // namespace capture
