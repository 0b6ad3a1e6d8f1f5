// Memory buffers on Linux: large blocks are reused rather than faulted in afresh.
#include <gtest/gtest.h>
#include <sys/resource.h>

#include <cstring>

#include "platform/mf.h"

namespace {

BYTE* dataOf(IMFMediaBuffer* buffer) {
  BYTE* data = nullptr;
  EXPECT_EQ(buffer->Lock(&data, nullptr, nullptr), S_OK);
  buffer->Unlock();
  return data;
}

TEST(MemoryBuffers, AReleasedFrameSizedBlockIsHandedOutAgain) {
  const DWORD frame = 1920 * 1080 * 4;
  IMFMediaBuffer* first = nullptr;
  ASSERT_EQ(MFCreateMemoryBuffer(frame, &first), S_OK);
  BYTE* block = dataOf(first);
  ASSERT_NE(block, nullptr);
  EXPECT_EQ(reinterpret_cast<uintptr_t>(block) % 64, 0u);
  std::memset(block, 1, frame);
  first->Release();

  // Filling a block that was already touched costs no page faults; a fresh one faults in
  // about two thousand pages.
  rusage before{}, after{};
  getrusage(RUSAGE_THREAD, &before);
  IMFMediaBuffer* second = nullptr;
  ASSERT_EQ(MFCreateMemoryBuffer(frame, &second), S_OK);
  EXPECT_EQ(dataOf(second), block);
  std::memset(dataOf(second), 2, frame);
  getrusage(RUSAGE_THREAD, &after);
  EXPECT_LT(after.ru_minflt - before.ru_minflt, 100);
  DWORD length = 1, maxLength = 0;
  EXPECT_EQ(second->GetCurrentLength(&length), S_OK);
  EXPECT_EQ(length, 0u);  // a reused block is a new buffer
  EXPECT_EQ(second->GetMaxLength(&maxLength), S_OK);
  EXPECT_EQ(maxLength, frame);

  // While the block is in use, another buffer gets a block of its own.
  IMFMediaBuffer* third = nullptr;
  ASSERT_EQ(MFCreateMemoryBuffer(frame, &third), S_OK);
  EXPECT_NE(dataOf(third), block);
  dataOf(third)[frame - 1] = 7;  // the whole length is writable
  third->Release();
  second->Release();
}

TEST(MemoryBuffers, ADifferentSizeDoesNotTakeAKeptBlock) {
  IMFMediaBuffer* big = nullptr;
  ASSERT_EQ(MFCreateMemoryBuffer(4 << 20, &big), S_OK);
  BYTE* block = dataOf(big);
  big->Release();
  IMFMediaBuffer* bigger = nullptr;
  ASSERT_EQ(MFCreateMemoryBuffer(6 << 20, &bigger), S_OK);
  EXPECT_NE(dataOf(bigger), block);
  dataOf(bigger)[(6 << 20) - 1] = 1;
  bigger->Release();
}

}  // namespace
