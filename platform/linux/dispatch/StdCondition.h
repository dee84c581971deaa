#pragma once

#include <memory>

#include "platform/Condition.h"

namespace tavrin {

// A condition over the real steady clock.
std::unique_ptr<Condition> MakeCondition();

}  // namespace tavrin
