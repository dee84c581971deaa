#include "platform/Platform.h"

#include <atomic>
#include <cstdio>
#include <cstdlib>

namespace tavrin {
namespace {
std::atomic<PlatformServices*> installed{nullptr};
}  // namespace

PlatformServices& CurrentPlatform() {
  PlatformServices* services = installed.load(std::memory_order_acquire);
  if (services == nullptr) {
    std::fputs("tavrin: no platform services installed\n", stderr);
    std::abort();
  }
  return *services;
}

PlatformServices* InstallPlatform(PlatformServices* services) {
  return installed.exchange(services, std::memory_order_acq_rel);
}

}  // namespace tavrin
