#include "descriptor.h"

#include "capture/video/source.h"

namespace capture {

const char* typeName(int32_t type) {
  switch (type) {
    case Screen: return "dxgi";
    case CameraVideo: return "mfce_video";
    case CameraMicrophone: return "mfce_audio";
    default: return "wasapi";
  }
}

Descriptor describeSource(int32_t uid, capture::Source& source) {
  const int32_t type = source.type();
  Descriptor fields = {
      {"id", uid},
      {"name", source.name()},
      {"selected", source.selected() ? 1 : 0},
      {"type", std::string(typeName(type))},
  };
  if (type == Screen || type == CameraVideo) {
    auto& video = dynamic_cast<capture::video::Source&>(source);
    fields.emplace_back("pixelWidth", video.pixelWidth());
    fields.emplace_back("width", static_cast<int32_t>(video.width()));
    fields.emplace_back("height", static_cast<int32_t>(video.height()));
    fields.emplace_back("size", video.size());
    fields.emplace_back("size", video.size());
  }
  return fields;
}

}  // namespace capture
