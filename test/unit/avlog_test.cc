#include "platform/linux/ffmpeg/avlog.h"

#include <gtest/gtest.h>

extern "C" {
#include <libavutil/log.h>
}

#include <string>

namespace {

struct Component {
  const AVClass* kind;
};
AVClass makeClass() {
  AVClass kind{};
  kind.class_name = "demo";
  kind.item_name = av_default_item_name;
  kind.version = LIBAVUTIL_VERSION_INT;
  return kind;
}
const AVClass componentClass = makeClass();

TEST(FFmpegLog, ErrorsBecomeWarningLinesAndNothingReachesStandardError) {
  platform::ffmpeg::routeLog();
  Component component{&componentClass};
  testing::internal::CaptureStdout();
  testing::internal::CaptureStderr();
  av_log(&component, AV_LOG_WARNING, "a warning\n");
  av_log(&component, AV_LOG_INFO, "some information\n");
  // One message written in two pieces is one line.
  av_log(&component, AV_LOG_ERROR, "Error opening '%s'", "x");
  av_log(&component, AV_LOG_ERROR, " with args 'y'\n");
  av_log(nullptr, AV_LOG_FATAL, "fatal %d\n", 3);
  av_log(&component, AV_LOG_ERROR, "\n");
  const std::string out = testing::internal::GetCapturedStdout();
  EXPECT_EQ(testing::internal::GetCapturedStderr(), "");

  const std::string first =
      "\tnative/platform/linux/avlog(46): 0x80004005: FFmpeg demo: Error opening 'x' with args 'y' "
      "(Unspecified error)\n";
  const std::string second = "\tnative/platform/linux/avlog(46): 0x80004005: FFmpeg: fatal 3 (Unspecified error)\n";
  const size_t at = out.find(first);
  ASSERT_NE(at, std::string::npos) << out;
  EXPECT_NE(out.find(second, at), std::string::npos) << out;
  EXPECT_EQ(out.find("warning"), std::string::npos) << out;
  EXPECT_EQ(out.find("information"), std::string::npos) << out;
  // Two warning lines, each of two output lines; the empty message printed nothing.
  size_t warnings = 0;
  for (size_t p = out.find(": Warning: "); p != std::string::npos; p = out.find(": Warning: ", p + 1)) ++warnings;
  EXPECT_EQ(warnings, 2u) << out;
}

}  // namespace
