#include "capture/audio/formats.h"

#include <gtest/gtest.h>

namespace {

using namespace capture::audio;

// The SDK declares MFAudioFormat_Float_SpatialObjects only for newer targets than the add-on's.
constexpr GUID kFloatSpatialObjects = {0xFA39CD94, 0xBC64, 0x4AB1, {0x9B, 0x71, 0xDC, 0xD0, 0x9D, 0x5A, 0x7E, 0x7A}};

TEST(AudioFormats, TableHasTheTwentyThreeRowsInOrder) {
  const auto& table = audioSubtypes();
  ASSERT_EQ(table.size(), 23u);
  EXPECT_EQ(table[0].name, "Advanced Audio Coding (AAC)");
  EXPECT_EQ(table[0].tag, 2);
  EXPECT_EQ(table[13].name, "Uncompressed Floating-Point Audio (SO)");
  EXPECT_EQ(table[14].tag, 3);
  EXPECT_EQ(table[22].name, "Windows Media Audio 9 Codec");
  // Rows of the wave-format family carry their tag in the base GUID.
  const uint32_t tags[] = {0x1610, 0x1600, 0x6C61, 0x7361, 0x7362, 0x7363, 0,      0x0092,
                           0,      0x0009, 0x0008, 0xF1AC, 0x0003, 0,      0x0055, 0x0050,
                           0x000A, 0x704F, 0x0001, 0x0164, 0x0163, 0x0161, 0x0162};
  for (size_t i = 0; i < table.size(); ++i) {
    if (!tags[i]) continue;
    const GUID expected = {tags[i], 0x0000, 0x0010, {0x80, 0x00, 0x00, 0xAA, 0x00, 0x38, 0x9B, 0x71}};
    EXPECT_EQ(table[i].subtype, expected) << "row " << i + 1;
  }
  const GUID ac3 = {0xE06D802C, 0xDB46, 0x11CF, {0xB4, 0xD1, 0x00, 0x80, 0x5F, 0x6C, 0xBB, 0xEA}};
  const GUID ddPlus = {0xA7FB87AF, 0x2D02, 0x42FB, {0xA4, 0xD4, 0x05, 0xCD, 0x93, 0x84, 0x3B, 0xDD}};
  EXPECT_EQ(table[6].subtype, ac3);
  EXPECT_EQ(table[8].subtype, ddPlus);
  EXPECT_EQ(table[13].subtype, kFloatSpatialObjects);
}

TEST(AudioFormats, LookUpNamesAndTags) {
  EXPECT_EQ(nameOfSubtype(MFAudioFormat_AAC), "Advanced Audio Coding (AAC)");
  EXPECT_EQ(nameOfSubtype(MFAudioFormat_PCM), "Uncompressed PCM Audio");
  EXPECT_EQ(nameOfSubtype(MFAudioFormat_Dolby_AC3_SPDIF), "Dolby AC-3 Audio / Sony/Philips Digital Interface");
  EXPECT_EQ(tagOfSubtype(MFAudioFormat_AAC), 2);
  EXPECT_EQ(tagOfSubtype(MFAudioFormat_MP3), 3);
  const GUID unknown = {0x12345678, 0x1, 0x2, {1, 2, 3, 4, 5, 6, 7, 8}};
  EXPECT_EQ(nameOfSubtype(unknown), "Unknown");
  EXPECT_EQ(tagOfSubtype(unknown), 0);
  EXPECT_EQ(nameOfSubtype(kFloatSpatialObjects), "Uncompressed Floating-Point Audio (SO)");
  EXPECT_EQ(tagOfSubtype(kFloatSpatialObjects), 0);
#ifndef _WIN32
  EXPECT_EQ(MFAudioFormat_Float_SpatialObjects, kFloatSpatialObjects);
#endif
  EXPECT_EQ(tagOfSubtype(MFAudioFormat_WMAudioV9), 0);
  // All sixteen bytes count.
  GUID almost = MFAudioFormat_AAC;
  almost.Data4[7] ^= 1;
  EXPECT_EQ(nameOfSubtype(almost), "Unknown");
}

TEST(AudioFormats, DescribesAWaveFormatInSevenLines) {
  WAVEFORMATEXTENSIBLE format{};
  format.Format = {WAVE_FORMAT_EXTENSIBLE, 2, 48000, 384000, 8, 32, 22};
  format.dwChannelMask = 3;
  format.SubFormat = KSDATAFORMAT_SUBTYPE_IEEE_FLOAT;
  testing::internal::CaptureStdout();
  describeWaveFormat(&format.Format);
  EXPECT_EQ(testing::internal::GetCapturedStdout(),
            "Format: 65534\nChannels: 2\nSamples Per Sec: 48000\nBytes Per Sec: 384000\nBlock Align: 8\n"
            "Bits Per Sample: 32\nSize: 22\n");
}

TEST(AudioFormats, PrintsFieldsAsUnsignedNumbers) {
  const WAVEFORMATEX format = {0xFFFF, 0xFFFF, 0xFFFFFFFF, 0x80000000, 0x8000, 8, 0};
  testing::internal::CaptureStdout();
  describeWaveFormat(&format);
  EXPECT_EQ(testing::internal::GetCapturedStdout(),
            "Format: 65535\nChannels: 65535\nSamples Per Sec: 4294967295\nBytes Per Sec: 2147483648\n"
            "Block Align: 32768\nBits Per Sample: 8\nSize: 0\n");
}

}  // namespace
