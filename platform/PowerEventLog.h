#pragma once

#include <cstdint>
#include <string>

#include "base/Dictionary.h"

namespace tavrin {

// The power-event log: registered events by agent number.
class PowerEventLog {
 public:
  virtual ~PowerEventLog() = default;
  // Records one event. `extra` is an optional fourth argument (nullptr when absent).
  virtual void LogRegisteredEvent(int32_t agent, const std::string& name, const Dictionary& payload,
                                  const Dictionary* extra) = 0;
};

}  // namespace tavrin
