// The loopback client over PulseAudio against a real server of the test's own: a null sink with a
// sine playing into it. What a capture thread sees when it holds a packet, and when the server
// dies under it.
#include <gtest/gtest.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <future>
#include <string>
#include <thread>
#include <vector>

#include "platform/com.h"
#include "platform/wasapi.h"
#include "support.h"

extern char** environ;

namespace {

using testsupport::eventually;

// pulseaudio in a folder of its own, found through PULSE_SERVER.
class PulseServer {
 public:
  PulseServer() {
    char folder[] = "/tmp/tavio-pulse-XXXXXX";
    if (!mkdtemp(folder)) return;  // no server: the tests find no endpoint and say so
    dir_ = folder;
    std::ofstream(dir_ + "/conf.pa") << "load-module module-native-protocol-unix auth-anonymous=1 socket=" << dir_
                                     << "/native\n"
                                     << "load-module module-null-sink sink_name=test_speakers\n"
                                     << "load-module module-sine sink=test_speakers frequency=440\n";
    setenv("PULSE_SERVER", ("unix:" + dir_ + "/native").c_str(), 1);
    // The server keeps its state in the folder, not in the user's.
    std::vector<std::string> env{"HOME=" + dir_, "XDG_RUNTIME_DIR=" + dir_};
    for (char** e = environ; *e; ++e)
      if (std::strncmp(*e, "HOME=", 5) != 0 && std::strncmp(*e, "XDG_RUNTIME_DIR=", 16) != 0) env.emplace_back(*e);
    std::vector<std::string> args{"pulseaudio", "--daemonize=no",  "--exit-idle-time=-1", "--system=false",   "-n",
                                  "-F",         dir_ + "/conf.pa", "--log-target=stderr", "--log-level=error"};
    std::vector<char*> argv, envp;
    for (auto& a : args) argv.push_back(a.data());
    for (auto& e : env) envp.push_back(e.data());
    argv.push_back(nullptr);
    envp.push_back(nullptr);
    if (posix_spawnp(&pid_, "pulseaudio", nullptr, nullptr, argv.data(), envp.data()) != 0) pid_ = -1;
  }

  ~PulseServer() {
    kill();
    if (!dir_.empty()) std::filesystem::remove_all(dir_);
  }

  void kill() {
    if (pid_ <= 0) return;
    ::kill(pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
    pid_ = -1;
  }

  // The default endpoint, once the server answers.
  ComPtr<IMMDevice> endpoint() {
    ComPtr<IMMDevice> found;
    eventually([&] {
      ComPtr<IMMDeviceEnumerator> enumerator;
      return pid_ > 0 &&
             SUCCEEDED(CoCreateInstance(CLSID_MMDeviceEnumerator, nullptr, CLSCTX_ALL, IID_IMMDeviceEnumerator,
                                        reinterpret_cast<void**>(enumerator.GetAddressOf()))) &&
             SUCCEEDED(enumerator->GetDefaultAudioEndpoint(eRender, eConsole, found.ReleaseAndGetAddressOf()));
    });
    return found;
  }

 private:
  std::string dir_;
  pid_t pid_ = -1;
};

// A started loopback client on the server's sink.
struct Loopback {
  ComPtr<IMMDevice> endpoint;
  ComPtr<IAudioClient> client;
  ComPtr<IAudioCaptureClient> packets;
  size_t frameBytes = 0;

  explicit Loopback(PulseServer& server) : endpoint(server.endpoint()) {
    if (!endpoint) return;
    WAVEFORMATEX* mix = nullptr;
    if (FAILED(endpoint->Activate(IID_IAudioClient, CLSCTX_ALL, nullptr,
                                  reinterpret_cast<void**>(client.GetAddressOf()))) ||
        FAILED(client->GetMixFormat(&mix)))
      return;
    frameBytes = mix->nBlockAlign;
    const HRESULT initialized =
        client->Initialize(AUDCLNT_SHAREMODE_SHARED, AUDCLNT_STREAMFLAGS_LOOPBACK, 1000000, 0, mix, nullptr);
    CoTaskMemFree(mix);
    if (FAILED(initialized) ||
        FAILED(client->GetService(IID_IAudioCaptureClient, reinterpret_cast<void**>(packets.GetAddressOf()))) ||
        FAILED(client->Start()))
      packets.Reset();
  }

  struct Packet {
    BYTE* data = nullptr;
    UINT32 frames = 0;
    DWORD flags = 0;
    UINT64 position = 0;
    UINT64 time = 0;
  };
  // Polls until a packet of the sine comes (not silence made up while the sink is slow to
  // deliver), and holds it. Packets before it are released.
  bool holdSound(Packet& p) {
    bool holding = false;
    return eventually([&] {
      if (!holding && packets->GetBuffer(&p.data, &p.frames, &p.flags, &p.position, &p.time) == S_OK) {
        holding = p.frames > 0 && !(p.flags & AUDCLNT_BUFFERFLAGS_SILENT);
        if (!holding) packets->ReleaseBuffer(p.frames);
      }
      return holding;
    });
  }
};

// Each test begins holding a packet of the sine.
class PulseLoopback : public testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(loopback.packets) << "no loopback client on the test's server";
    ASSERT_TRUE(loopback.holdSound(held));
  }

  PulseServer server;
  Loopback loopback{server};
  Loopback::Packet held;
};

TEST_F(PulseLoopback, APacketReleasedUnreadComesAgainAndTheNextFollowsIt) {
  const std::vector<BYTE> sound(held.data, held.data + held.frames * loopback.frameBytes);

  ASSERT_EQ(loopback.packets->ReleaseBuffer(0), S_OK);
  Loopback::Packet again;
  ASSERT_EQ(loopback.packets->GetBuffer(&again.data, &again.frames, &again.flags, &again.position, &again.time), S_OK);
  EXPECT_EQ(again.frames, held.frames);
  EXPECT_EQ(again.position, held.position);
  EXPECT_EQ(again.time, held.time);
  EXPECT_EQ(std::vector<BYTE>(again.data, again.data + again.frames * loopback.frameBytes), sound);

  ASSERT_EQ(loopback.packets->ReleaseBuffer(again.frames), S_OK);
  Loopback::Packet next;
  ASSERT_TRUE(loopback.holdSound(next));
  EXPECT_EQ(next.position, held.position + held.frames);
  EXPECT_EQ(loopback.packets->ReleaseBuffer(next.frames), S_OK);
}

// libpulse frees a dead server's memory holding the main loop's lock and waits until no block of
// it is in use; a packet that still pointed into that memory would keep the release below (which
// needs the lock) waiting for ever, and the capture thread with it.
TEST_F(PulseLoopback, APacketHeldWhenTheServerDiesIsReleasedAndTheDeviceIsLost) {
  server.kill();
  // Time for the client's main loop to see the connection end.
  std::this_thread::sleep_for(std::chrono::milliseconds(300));
  auto done = std::make_shared<std::promise<HRESULT>>();
  std::future<HRESULT> released = done->get_future();
  IAudioCaptureClient* packets = loopback.packets.Get();
  std::thread([done, packets, frames = held.frames] { done->set_value(packets->ReleaseBuffer(frames)); }).detach();
  if (released.wait_for(std::chrono::seconds(5)) != std::future_status::ready) {
    // The clients stay as they are: releasing them would wait for the same lock.
    loopback.packets.Detach();
    loopback.client.Detach();
    loopback.endpoint.Detach();
    FAIL() << "ReleaseBuffer still waits 5 s after the server died";
  }
  EXPECT_EQ(released.get(), AUDCLNT_E_DEVICE_INVALIDATED);
  BYTE* data = nullptr;
  UINT32 frames = 0;
  DWORD flags = 0;
  EXPECT_EQ(loopback.packets->GetBuffer(&data, &frames, &flags, nullptr, nullptr), AUDCLNT_E_DEVICE_INVALIDATED);
}

}  // namespace
