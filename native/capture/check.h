// The one failure check of every platform call, and the out-of-range look-up.
#pragma once

#include <cstdint>
#include <stdexcept>
#include <string>
#include <vector>

#include "platform/com.h"

namespace capture {

// Throws std::runtime_error with time, file, line, code, message and the system's description
// when hr is negative; success codes (S_FALSE and 1 included) pass.
void checkResult(const char* file, int32_t line, HRESULT hr, const char* message);

// The system's description of a code, with the fallbacks for codes that have none.
std::string systemMessage(HRESULT hr);

// The description made from a text FormatMessageA returned (null or length 0: none came back).
std::string systemMessage(HRESULT hr, const char* text, uint32_t length);

// Element access that fails with the text users of the add-on see for a bad index.
template <class T>
T& at(std::vector<T>& items, size_t index) {
  if (index >= items.size()) throw std::out_of_range("invalid vector<T> subscript");
  return items[index];
}
template <class T>
const T& at(const std::vector<T>& items, size_t index) {
  if (index >= items.size()) throw std::out_of_range("invalid vector<T> subscript");
  return items[index];
}

}  // namespace capture
