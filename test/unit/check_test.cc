// Failure texts, system messages, log lines and text conversions.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstring>
#include <iostream>
#include <regex>
#include <sstream>

#include "capture/check.h"
#include "support.h"
#include "capture/log.h"
#include "capture/text.h"
#include "wine.h"

using ::testing::EndsWith;
using ::testing::HasSubstr;

namespace {

std::string failureText(HRESULT hr, const char* message) {
  return testsupport::failureOf([&] { capture::checkResult("native/interface", 47, hr, message); });
}

// Captures what a call writes to std::cout.
template <class F>
std::string coutOf(F call) {
  std::ostringstream captured;
  std::streambuf* old = std::cout.rdbuf(captured.rdbuf());
  call();
  std::cout.rdbuf(old);
  return captured.str();
}

TEST(CheckResult, EveryCodeWithTheHighBitClearPasses) {
  EXPECT_NO_THROW(capture::checkResult("f", 1, 0x7FFFFFFF, "x"));
}

TEST(CheckResult, FailureTextHasTimeLineFileCodeMessageAndSystemText) {
  const std::string text = failureText(E_POINTER, "x");
  // asctime's form, its own newline, then a tab. std::regex, since GoogleTest's own regex on
  // Windows knows neither groups nor alternation.
  const std::regex form(
      "(Sun|Mon|Tue|Wed|Thu|Fri|Sat) (Jan|Feb|Mar|Apr|May|Jun|Jul|Aug|Sep|Oct|Nov|Dec) "
      "[ 123][0-9] [0-2][0-9]:[0-5][0-9]:[0-6][0-9] [0-9]{4}\n\t[^\n]*");
  EXPECT_TRUE(std::regex_match(text, form)) << text;
  EXPECT_THAT(text, HasSubstr("\tnative/interface(47): 0x80004003: x ("));
  if (testsupport::underWine()) GTEST_SKIP() << "Wine has no system text for E_POINTER";
  EXPECT_THAT(text, EndsWith("\tnative/interface(47): 0x80004003: x (Invalid pointer)"));
}

TEST(CheckResult, TheDuplicationsLostAccessHasItsSystemText) {
  if (testsupport::underWine()) GTEST_SKIP() << "Wine has no system text for DXGI_ERROR_ACCESS_LOST (0x887A0026)";
  EXPECT_THAT(failureText(static_cast<HRESULT>(0x887A0026), "m"), HasSubstr("0x887a0026: m (The desktop duplication"));
}

TEST(SystemMessage, TextsLoseTheirLineEndOnly) {
  EXPECT_EQ(capture::systemMessage(E_FAIL, "abc\r\n", 5), "abc");
  EXPECT_EQ(capture::systemMessage(E_FAIL, "abc\n", 4), "abc");
  EXPECT_EQ(capture::systemMessage(E_FAIL, "ab\r", 3), "ab\r");
  EXPECT_EQ(capture::systemMessage(E_FAIL, "\n", 1), "\n");  // one character stays as it is
  EXPECT_EQ(capture::systemMessage(E_FAIL, "\r\n", 2), "");
}

TEST(SystemMessage, FallbacksForCodesWithoutText) {
  EXPECT_EQ(capture::systemMessage(static_cast<HRESULT>(0x80040201), nullptr, 0), "IDispatch error #1");
  EXPECT_EQ(capture::systemMessage(static_cast<HRESULT>(0x8004FFFF), nullptr, 0), "IDispatch error #65023");
  EXPECT_EQ(capture::systemMessage(static_cast<HRESULT>(0x80040200), nullptr, 0), "Unknown error 0x80040200");
  EXPECT_EQ(capture::systemMessage(static_cast<HRESULT>(0x88890004), nullptr, 0), "Unknown error 0x88890004");
  EXPECT_EQ(capture::systemMessage(static_cast<HRESULT>(0x8004abcd), nullptr, 0), "IDispatch error #43469");
}

TEST(SystemMessage, ComesFromTheSystemTable) {
  // WASAPI's codes have no system text on Windows either.
  EXPECT_EQ(capture::systemMessage(static_cast<HRESULT>(0x88890004)), "Unknown error 0x88890004");
  if (testsupport::underWine())
    GTEST_SKIP() << "Wine has no system text for E_POINTER, RPC_E_CHANGED_MODE and REGDB_E_CLASSNOTREG, and words "
                    "ERROR_PATH_NOT_FOUND's as \""
                 << capture::systemMessage(HRESULT_FROM_WIN32(ERROR_PATH_NOT_FOUND)) << '"';
  EXPECT_EQ(capture::systemMessage(HRESULT_FROM_WIN32(ERROR_PATH_NOT_FOUND)),
            "The system cannot find the path specified.");
  EXPECT_EQ(capture::systemMessage(E_POINTER), "Invalid pointer");
  EXPECT_EQ(capture::systemMessage(RPC_E_CHANGED_MODE), "Cannot change thread mode after it is set.");
  EXPECT_EQ(capture::systemMessage(static_cast<HRESULT>(0x80040154)), "Class not registered");
}

TEST(FormatMessage, AllocatesATextEndingInCarriageReturnLineFeed) {
  char* text = nullptr;
  DWORD length =
      FormatMessageA(FORMAT_MESSAGE_ALLOCATE_BUFFER | FORMAT_MESSAGE_FROM_SYSTEM | FORMAT_MESSAGE_IGNORE_INSERTS,
                     nullptr, static_cast<DWORD>(E_OUTOFMEMORY), 0, reinterpret_cast<LPSTR>(&text), 0, nullptr);
  ASSERT_NE(text, nullptr);
  const std::string message = text;
  EXPECT_THAT(message, EndsWith(".\r\n"));
  EXPECT_EQ(length, std::strlen(text));
  LocalFree(text);
  text = nullptr;
  EXPECT_EQ(FormatMessageA(0x1300, nullptr, 0x88890001, 0, reinterpret_cast<LPSTR>(&text), 0, nullptr), 0u);
  EXPECT_EQ(text, nullptr);
  if (testsupport::underWine())
    GTEST_SKIP() << "Wine words E_OUTOFMEMORY's system text as \"" << message.substr(0, message.size() - 2) << '"';
  EXPECT_EQ(message, "Not enough memory resources are available to complete this operation.\r\n");
}

TEST(Log, WarningAndTestingLines) {
  std::regex warning("[0-9]{13}: Warning: disk full\n");
  EXPECT_TRUE(std::regex_match(coutOf([] { capture::logWarning("disk full"); }), warning));
  std::regex testing("[0-9]{13}: Testing: probe\n");
  EXPECT_TRUE(std::regex_match(coutOf([] { capture::logTesting("probe"); }), testing));
  EXPECT_THAT(coutOf([] { capture::logWarning(nullptr); }), EndsWith(": Warning: unknown exception\n"));
}

TEST(Log, TempFileNamesPadToFourDigits) {
  EXPECT_EQ(capture::tempFileName(7, ".mp4"), "temp-0007.mp4");
  EXPECT_EQ(capture::tempFileName(12345, ""), "temp-12345");
  EXPECT_EQ(capture::tempFileName(0, ".wav"), "temp-0000.wav");
}

TEST(Text, RoundTripsOutsideTheBasicPlane) {
  const std::string utf8 = "clip-\xF0\x9F\x8E\xA5-\xC3\xA9.mp4";  // a film camera emoji and é
  const std::wstring wide = capture::toWide(utf8);
  ASSERT_EQ(wide.size(), 5u + 2u + 1u + 1u + 4u);  // the emoji is a surrogate pair
  EXPECT_EQ(wide[5], 0xD83C);
  EXPECT_EQ(wide[6], 0xDFA5);
  EXPECT_EQ(capture::toUtf8(wide), utf8);
#ifndef _WIN32
  EXPECT_EQ(platform::narrow(wide.c_str()), utf8);  // our platform layer reads the same units
#endif
  EXPECT_THROW(capture::toWide("Caf\xE9 Display"), std::range_error);  // an ANSI name
}

TEST(At, OutOfRangeHasTheHostsText) {
  std::vector<int> items = {1, 2};
  EXPECT_EQ(capture::at(items, 1), 2);
  try {
    capture::at(items, 2);
    FAIL() << "no exception";
  } catch (const std::out_of_range& e) {
    EXPECT_STREQ(e.what(), "invalid vector<T> subscript");
  }
}

}  // namespace
