// The add-on's face toward Node: the module record, the seven functions, the source list,
// event delivery, the screen pump and the clips finished at exit.
#include <nan.h>
#include <node.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <iostream>
#include <limits>
#include <memory>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "capture/audio/source.h"
#include "capture/check.h"
#include "capture/clock.h"
#include "capture/log.h"
#include "capture/threadname.h"
#include "capture/video/screen/dxgi/source.h"
#include "capture/video/source.h"
#include "descriptor.h"
#include "discovery.h"
#include "platform/com.h"
#include "platform/user32.h"

namespace {

constexpr const char* kFile = "native/interface";
constexpr WPARAM kTransferCommand = 0x7F8F;

using capture::SourceList;

// Process-wide state. The list and the callback are never destroyed: detached threads use the
// list until the process ends, and tearing down a V8 handle after V8 is gone would crash at exit.
v8::Isolate* isolate = nullptr;
SourceList& sources = *new SourceList;
Nan::Persistent<v8::Function>& callback = *new Nan::Persistent<v8::Function>;

v8::Isolate* currentIsolate(const Nan::FunctionCallbackInfo<v8::Value>& info) {
  return isolate ? isolate : info.GetIsolate();
}

// An argument counts only when it is a 32-bit integer; anything else is 0.
int32_t intArgument(const Nan::FunctionCallbackInfo<v8::Value>& info, int index) {
  if (index >= info.Length() || !info[index]->IsInt32()) return 0;
  v8::Local<v8::Context> context = currentIsolate(info)->GetCurrentContext();
  return static_cast<int32_t>(info[index]->IntegerValue(context).FromMaybe(0));
}

void set(v8::Local<v8::Object> object, const char* key, v8::Local<v8::Value> value) {
  Nan::Set(object, Nan::New(key).ToLocalChecked(), value);
}

// Delivers one event to the stored callback, synchronously, inside its own async context.
void emitEvent(v8::Local<v8::Object> event) {
  if (callback.IsEmpty()) return;  // initialize refuses to run without one; nothing else may crash
  v8::Isolate* js = isolate ? isolate : v8::Isolate::GetCurrent();
  v8::HandleScope scope(js);
  v8::Local<v8::Context> context = js->GetCurrentContext();
  v8::Local<v8::Object> resource = v8::Object::New(js);
  node::async_context asyncContext = node::EmitAsyncInit(js, resource, "nan:Callback:operator()", -1);
  v8::Local<v8::Value> argv[] = {event};
  node::MakeCallback(js, context->Global(), Nan::New(callback), 1, argv, asyncContext);
  node::EmitAsyncDestroy(js, asyncContext);
}

v8::Local<v8::Object> newSourceEvent(int32_t uid, capture::Source& source) {
  v8::Local<v8::Object> descriptor = Nan::New<v8::Object>();
  for (const auto& [key, value] : capture::describeSource(uid, source)) {
    if (const auto* number = std::get_if<int32_t>(&value))
      set(descriptor, key.c_str(), Nan::New(*number));
    else
      set(descriptor, key.c_str(), Nan::New(std::get<std::string>(value)).ToLocalChecked());
  }
  v8::Local<v8::Object> event = Nan::New<v8::Object>();
  set(event, "type", Nan::New("new source").ToLocalChecked());
  set(event, "source", descriptor);
  return event;
}

// Keeps every display capturing; its pace is the displays' own acquisition time-out. With no
// display, or after a failure (a display server gone), it pauses instead of spinning.
void screenPump() {
  capture::nameThread("tavio-screen");
  constexpr auto pause = std::chrono::milliseconds(100);
  for (;;) {
    bool anyScreen = false;
    try {
      for (size_t i = 0; i < sources.size(); ++i) {
        std::shared_ptr<capture::Source> source = sources[i];
        if (source->type() != capture::Screen) continue;
        anyScreen = true;
        source->capture();
      }
    } catch (const std::runtime_error& e) {
      capture::logWarning(e.what());
      anyScreen = false;
    }
    if (!anyScreen) std::this_thread::sleep_for(pause);
  }
}

NAN_METHOD(initialize) {
  isolate = info.GetIsolate();
  // Without a callback no "new source" event could reach the host, which then could not know a
  // uid; so nothing is found or started, and initialize may be called again after setCallback.
  if (callback.IsEmpty()) {
    try {
      capture::checkResult(kFile, 52, E_POINTER, "initialize: no event callback; call setCallback first.");
    } catch (const std::runtime_error& e) {
      capture::logWarning(e.what());
    }
    return;
  }
  try {
    capture::discoverSources(sources);

    std::thread(screenPump).detach();

    for (size_t i = 0; i < sources.size(); ++i) {
      std::shared_ptr<capture::Source> source = sources[i];
      emitEvent(newSourceEvent(static_cast<int32_t>(i), *source));
    }
  } catch (const std::runtime_error& e) {
    std::cout << e.what() << std::endl;
  }
}

NAN_METHOD(getPreview) {
  const int32_t uid = intArgument(info, 0);
  std::shared_ptr<capture::Source> source = capture::at(sources, static_cast<size_t>(uid));

  if (source->isAudio()) {
    auto& audio = dynamic_cast<capture::audio::Source&>(*source);
    const uint16_t channels = audio.channels();
    v8::Local<v8::Object> peaks = Nan::New<v8::Object>();
    set(peaks, "left", Nan::New(audio.peak(0)));
    set(peaks, "right", Nan::New(channels == 2 ? audio.peak(1) : audio.peak(0)));
    for (uint16_t channel = 0; channel < channels; ++channel)
      set(peaks, std::to_string(channel).c_str(), Nan::New(audio.peak(channel)));
    info.GetReturnValue().Set(peaks);
    return;
  }

  try {
    const int32_t width = intArgument(info, 1);
    const int32_t height = intArgument(info, 2);
    if (width < 0 || height < 0) throw std::invalid_argument("preview size must not be negative");
    auto& video = dynamic_cast<capture::video::Source&>(*capture::at(sources, static_cast<size_t>(uid)));
    const uint64_t bytes =
        static_cast<uint64_t>(video.pixelWidth()) * static_cast<uint64_t>(height) * static_cast<uint64_t>(width);
    // The scaler addresses the picture with 32-bit signed offsets, and a typed array holds at
    // most kMaxLength bytes: anything larger would be written out of bounds.
    constexpr uint64_t largest = std::min<uint64_t>(std::numeric_limits<int32_t>::max(), v8::TypedArray::kMaxLength);
    if (bytes > largest) {
      const std::string text = "getPreview: a preview of " + std::to_string(width) + "x" + std::to_string(height) +
                               " pixels is larger than " + std::to_string(largest) + " bytes.";
      capture::checkResult(kFile, 175, E_INVALIDARG, text.c_str());
    }
    // V8's own allocation ends the process when memory runs out; memory of our own is refused
    // with a warning instead, and handed to the array buffer, which frees it.
    void* memory = std::malloc(bytes ? bytes : 1);
    if (!memory) capture::checkResult(kFile, 181, E_OUTOFMEMORY, "getPreview: no memory for the preview.");
    std::shared_ptr<v8::BackingStore> store = v8::ArrayBuffer::NewBackingStore(
        memory, bytes, [](void* data, size_t, void*) { std::free(data); }, nullptr);
    v8::Local<v8::ArrayBuffer> buffer = v8::ArrayBuffer::New(currentIsolate(info), store);
    if (video.preview(static_cast<uint8_t*>(buffer->Data()), 1, width, height))
      info.GetReturnValue().Set(v8::Uint8ClampedArray::New(buffer, 0, buffer->ByteLength()));
  } catch (const std::exception& e) {
    capture::logWarning(e.what());
  }
}

NAN_METHOD(transfer) {
  HWND window = reinterpret_cast<HWND>(static_cast<intptr_t>(intArgument(info, 0)));
  const BOOL posted = PostMessageA(window, WM_COMMAND, kTransferCommand, 0);
  SetForegroundWindow(window);
  info.GetReturnValue().Set(static_cast<uint32_t>(static_cast<uint8_t>(posted)));
}

NAN_METHOD(setCallback) {
  // Anything but a function is a programming error of the host: the engine's checked
  // conversion ends the process, as it always has.
  v8::MaybeLocal<v8::Function> function;
  if (info.Length() > 0 && info[0]->IsFunction()) function = info[0].As<v8::Function>();
  callback.Reset(function.ToLocalChecked());
}

NAN_METHOD(startCapture) {
  const int32_t uid = intArgument(info, 0);
  std::string filename;
  if (info.Length() >= 2 && info[1]->IsString()) filename = *Nan::Utf8String(info[1]);
  if (filename.empty()) return;

  try {
    capture::at(sources, static_cast<size_t>(uid))->startEncode(filename);
  } catch (const std::exception& e) {
    capture::logWarning(e.what());
  }

  v8::Local<v8::Object> event = Nan::New<v8::Object>();
  set(event, "type", Nan::New("new-clip").ToLocalChecked());
  set(event, "uid", Nan::New(uid));
  set(event, "filename", Nan::New(filename).ToLocalChecked());
  set(event, "start", Nan::New(static_cast<double>(capture::currentTimeMillis())));
  emitEvent(event);
}

NAN_METHOD(stopCapture) {
  const int32_t uid = intArgument(info, 0);
  try {
    capture::at(sources, static_cast<size_t>(uid))->stopEncode();
  } catch (const std::exception& e) {
    capture::logWarning(e.what());
  }
}

NAN_METHOD(mouseCapture) {
  const int32_t uid = intArgument(info, 0);
  const int32_t enabled = intArgument(info, 1);
  try {
    std::shared_ptr<capture::Source> source = capture::at(sources, static_cast<size_t>(uid));
    auto* screen = dynamic_cast<capture::video::screen::dxgi::Source*>(source.get());
    if (!screen) throw std::invalid_argument("mouseCapture: source " + std::to_string(uid) + " is not a display");
    screen->captureMouse = enabled != 0;
  } catch (const std::exception& e) {
    capture::logWarning(e.what());
  }
}

// A host that ends while clips record (process.exit, the end of its script, an uncaught exception,
// a signal) would lose what they had not written yet, and on Windows a whole clip, since its file
// gets its index only when it is finished. So before the process goes, while every thread still
// runs, each source stops its clip and the files are finished, for a few seconds at the most.
void finishEveryClip() {
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(3);
  // Every clip ends at this moment, before any file is waited for: a camera's stop may wait for
  // its microphone's last sound, and clips stopped after it would run on meanwhile.
  for (const auto& source : sources) source->endClip();
  for (const auto& source : sources) {
    try {
      source->finishClips(deadline);
    } catch (const std::exception& e) {
      capture::logWarning(e.what());
    }
  }
}

// object[key], or undefined when `object` is not an object or has no such property.
v8::Local<v8::Value> property(v8::Local<v8::Value> object, const char* key) {
  v8::Local<v8::Value> value;
  if (object.IsEmpty() || !object->IsObject() ||
      !Nan::Get(object.As<v8::Object>(), Nan::New(key).ToLocalChecked()).ToLocal(&value))
    return Nan::Undefined();
  return value;
}

v8::Local<v8::Value> processObject() { return property(Nan::GetCurrentContext()->Global(), "process"); }

// process[name](...argv); an empty handle when there is no such method or it threw.
v8::Local<v8::Value> callProcess(const char* name, int argc, v8::Local<v8::Value> argv[]) {
  v8::Local<v8::Value> process = processObject();
  v8::Local<v8::Value> method = property(process, name);
  if (!method->IsFunction()) return {};
  return Nan::Call(method.As<v8::Function>(), process.As<v8::Object>(), argc, argv).FromMaybe(v8::Local<v8::Value>());
}

NAN_METHOD(finishClipsAtExit) { finishEveryClip(); }

// A signal the host does not handle ends the process as before, once the clips are finished: the
// listener goes and the signal is raised again. A host with a listener of its own decides itself;
// when it exits, the exit event finishes the clips. This listener comes first, so that a host's
// `once` listener is still counted.
NAN_METHOD(finishClipsOnSignal) {
  v8::Local<v8::Value> signal = info[0];
  v8::Local<v8::Value> listeners = callProcess("listenerCount", 1, &signal);
  if (listeners.IsEmpty() || !listeners->IsNumber() || Nan::To<double>(listeners).FromJust() > 1) return;
  finishEveryClip();
  callProcess("removeAllListeners", 1, &signal);
  v8::Local<v8::Value> argv[] = {property(processObject(), "pid"), signal};
  callProcess("kill", 2, argv);
}

void listen(const char* how, const char* event, Nan::FunctionCallback handler) {
  v8::Local<v8::Value> argv[] = {Nan::New(event).ToLocalChecked(),
                                 Nan::GetFunction(Nan::New<v8::FunctionTemplate>(handler)).ToLocalChecked()};
  callProcess(how, 2, argv);
}

// Electron quits an app on these signals through handlers of its own, which a listener here would
// replace; its quit ends in the exit event, which finishes the clips.
bool inElectron() { return !property(property(processObject(), "versions"), "electron")->IsUndefined(); }

void initModule(v8::Local<v8::Object> exports, v8::Local<v8::Value>, void*) {
  listen("on", "exit", finishClipsAtExit);
  // The signals that end a process from its terminal or its session.
  if (!inElectron())
    for (const char* signal : {"SIGINT", "SIGTERM", "SIGHUP"}) listen("prependListener", signal, finishClipsOnSignal);
  Nan::SetMethod(exports, "initialize", initialize);
  Nan::SetMethod(exports, "getPreview", getPreview);
  Nan::SetMethod(exports, "transfer", transfer);
  Nan::SetMethod(exports, "setCallback", setCallback);
  Nan::SetMethod(exports, "startCapture", startCapture);
  Nan::SetMethod(exports, "stopCapture", stopCapture);
  Nan::SetMethod(exports, "mouseCapture", mouseCapture);
}

}  // namespace

extern "C" {
static node::node_module moduleRecord = {
    NODE_MODULE_VERSION,  // the ABI of the Node that builds the add-on
    0,
    nullptr,
    __FILE__,
    initModule,
    nullptr,
    "tavio_capture",
    nullptr,
    nullptr,
};
NODE_C_CTOR(_register_tavio_capture_) { node_module_register(&moduleRecord); }
}
