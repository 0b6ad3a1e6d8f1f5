// The interface of an enumerator of one family of devices.
#pragma once

#include <memory>
#include <vector>

#include "capture/source.h"

namespace capture {

class CaptureMethod {
 public:
  virtual ~CaptureMethod() = default;
  virtual bool available() = 0;
  virtual std::vector<std::shared_ptr<capture::Source>> sources() = 0;
};

}  // namespace capture
