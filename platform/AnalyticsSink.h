#pragma once

#include <functional>
#include <string>

#include "base/Dictionary.h"

namespace tavrin {

// The analytics event sink.
class AnalyticsSink {
 public:
  virtual ~AnalyticsSink() = default;
  // Sends one event named `name`. `buildPayload` is called only if and when the sink wants the
  // event (on a thread of the sink's choosing); a sink switched off never calls it.
  virtual void SendEventLazy(const std::string& name, std::function<Dictionary()> buildPayload) = 0;
};

}  // namespace tavrin
