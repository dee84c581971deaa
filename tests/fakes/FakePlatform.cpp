#include "tests/fakes/FakePlatform.h"

namespace tavrin::testing {

FakePlatform::FakePlatform() {
  services.dispatcher = &dispatcher;
  services.random = &random;
  services.telvoro = &telvoro;
  services.analytics = &analytics;
  services.powerLog = &powerLog;
  services.driverStats = &driverStats;
  services.orientation = &orientation;
  services.deviceInfo = &deviceInfo;
  services.fileSystem = &fileSystem;
  services.diagnosticDirectory = kDiagnosticDirectory;
  services.spoolDirectory = kSpoolDirectory;
  fileSystem.AddDirectory(kSpoolDirectory);
}

FakePlatform::~FakePlatform() {
  // Callbacks registered by sessions hold them; drop them while the other fakes still exist.
  orientation.Clear();
}

}  // namespace tavrin::testing
