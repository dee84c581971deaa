#include "platform/Dispatcher.h"

namespace tavrin {

std::string_view QualityOfServiceName(QualityOfService qos) {
  switch (qos) {
    case QualityOfService::kUserInteractive:
      return "user-interactive";
    case QualityOfService::kUserInitiated:
      return "user-initiated";
    case QualityOfService::kDefault:
      return "default";
    case QualityOfService::kUtility:
      return "utility";
    case QualityOfService::kBackground:
      return "background";
  }
  return "default";
}

}  // namespace tavrin
