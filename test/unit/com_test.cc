// Apartments, class creation and property values of the Linux COM layer.
#include <gtest/gtest.h>

#include <thread>

#include "platform/com.h"

namespace {

TEST(Apartments, ModesAndCountsArePerThread) {
  std::thread([] {
    EXPECT_EQ(CoInitializeEx(nullptr, COINIT_APARTMENTTHREADED | COINIT_SPEED_OVER_MEMORY), S_OK);
    EXPECT_EQ(CoInitializeEx(nullptr, COINIT_APARTMENTTHREADED), S_FALSE);
    EXPECT_EQ(CoInitializeEx(nullptr, COINIT_MULTITHREADED), RPC_E_CHANGED_MODE);
    std::thread([] { EXPECT_EQ(CoInitializeEx(nullptr, COINIT_MULTITHREADED), S_OK); }).join();
    CoUninitialize();
    CoUninitialize();
    // Fully left: a new mode may be chosen.
    EXPECT_EQ(CoInitializeEx(nullptr, COINIT_MULTITHREADED), S_OK);
    CoUninitialize();
  }).join();
}

TEST(Classes, UnknownClassesAndAggregationAreRefused) {
  constexpr GUID unknown = {0x12345678, 0x1234, 0x1234, {1, 2, 3, 4, 5, 6, 7, 8}};
  void* object = reinterpret_cast<void*>(1);
  EXPECT_EQ(CoCreateInstance(unknown, nullptr, CLSCTX_ALL, IID_IUnknown, &object), REGDB_E_CLASSNOTREG);
  EXPECT_EQ(object, nullptr);
  EXPECT_EQ(CoCreateInstance(GUID_NULL, nullptr, CLSCTX_ALL, IID_IUnknown, &object), REGDB_E_CLASSNOTREG);
  EXPECT_EQ(CoCreateInstance(unknown, nullptr, CLSCTX_ALL, IID_IUnknown, nullptr), E_POINTER);
}

TEST(PropVariant, ClearFreesStringsAndEmpties) {
  PROPVARIANT value;
  PropVariantInit(&value);
  value.vt = VT_LPWSTR;
  value.pwszVal = platform::taskString(L"Speakers");
  EXPECT_EQ(PropVariantClear(&value), S_OK);
  EXPECT_EQ(value.vt, VT_EMPTY);
  EXPECT_EQ(value.pwszVal, nullptr);
  EXPECT_EQ(PropVariantClear(nullptr), E_INVALIDARG);
}

struct ITest : IUnknown {};
constexpr GUID IID_ITest = {0xA1, 2, 3, {4, 5, 6, 7, 8, 9, 10, 11}};
struct Counted : platform::ComObject<ITest, IID_ITest> {
  explicit Counted(bool& gone) : gone(gone) {}
  ~Counted() override { gone = true; }
  bool& gone;
};

TEST(ComObject, AnswersItsInterfacesAndDiesWithTheLastReference) {
  bool gone = false;
  auto* object = new Counted(gone);
  void* same = nullptr;
  EXPECT_EQ(object->QueryInterface(IID_ITest, &same), S_OK);
  EXPECT_EQ(same, static_cast<ITest*>(object));
  EXPECT_EQ(object->QueryInterface(IID_IClassFactory, &same), E_NOINTERFACE);
  EXPECT_EQ(same, nullptr);
  EXPECT_EQ(object->Release(), 1u);
  EXPECT_FALSE(gone);
  EXPECT_EQ(object->Release(), 0u);
  EXPECT_TRUE(gone);
}

// Each holder owns one reference: copies count, moves and Attach take over, reassignment, &,
// Reset and the destructor let the old one go, Detach and CopyTo hand one out.
TEST(ComPtr, HoldsExactlyOneReferenceEach) {
  bool gone = false;
  auto* object = new Counted(gone);  // one reference, the creator's
  {
    ComPtr<ITest> first;
    first.Attach(object);
    ComPtr<ITest> copy = first;
    ComPtr<IUnknown> wider = copy;  // to a base interface
    EXPECT_EQ(object->AddRef(), 4u);
    EXPECT_EQ(object->Release(), 3u);
    ComPtr<ITest> moved = std::move(copy);
    EXPECT_FALSE(copy);  // NOLINT(bugprone-use-after-move): a moved-from holder is empty
    EXPECT_EQ(moved.Get(), first.Get());
    moved = moved;  // NOLINT: assigning a holder to itself keeps the reference
    EXPECT_EQ(object->AddRef(), 4u);
    object->Release();
    ITest* out = nullptr;
    EXPECT_EQ(first.CopyTo(&out), S_OK);
    EXPECT_EQ(out, object);
    EXPECT_EQ(object->Release(), 3u);  // CopyTo's reference
    wider.Reset();
    *&moved = nullptr;  // & releases before a call fills the slot
    EXPECT_EQ(object->AddRef(), 2u);
    object->Release();
    ITest* kept = first.Detach();
    EXPECT_EQ(first.Get(), nullptr);
    EXPECT_FALSE(gone);
    first.Attach(kept);
  }
  EXPECT_TRUE(gone);
}

// Win32 errors map into facility 7 as the sink writer's tests see; success stays S_OK.
TEST(Hresults, Win32SuccessIsSOkAndTheTypesHaveTheirWindowsSizes) {
  EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_SUCCESS), S_OK);
  EXPECT_EQ(sizeof(DWORD), 4u);
  EXPECT_EQ(sizeof(GUID), 16u);
}

}  // namespace
