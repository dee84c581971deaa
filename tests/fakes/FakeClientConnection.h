#pragma once

#include <functional>
#include <memory>
#include <string>

#include "platform/ServiceListener.h"

namespace tavrin::testing {

// A client connection driven by the test: it keeps the object and handlers the delegate set on it
// and lets the test end the connection the way the transport would.
class FakeClientConnection final : public ClientConnection {
 public:
  explicit FakeClientConnection(int32_t pid) : pid_(pid) {}

  int32_t ProcessIdentifier() const override { return pid_; }
  uint32_t UserIdentifier() const override { return 0; }
  void SetExportedInterface(std::string_view) override {}
  void SetExportedObject(std::shared_ptr<RuvoReportingServiceProtocol> object) override {
    object_ = std::move(object);
  }
  std::shared_ptr<RuvoReportingServiceProtocol> ExportedObject() const override { return object_; }
  void SetInterruptionHandler(std::function<void()> handler) override {
    interruption_ = std::move(handler);
  }
  void SetInvalidationHandler(std::function<void()> handler) override {
    invalidation_ = std::move(handler);
  }
  void Resume() override {}
  std::string Description() const override {
    return "<FakeClientConnection pid=" + std::to_string(pid_) + ">";
  }

  // Ends the connection: abnormally runs the interruption handler first; either way runs the
  // invalidation handler once and lets go of the exported object, as a closed connection does.
  void End(bool abnormal) {
    if (abnormal && interruption_) interruption_();
    if (invalidation_) invalidation_();
    interruption_ = nullptr;
    invalidation_ = nullptr;
    object_.reset();
  }

 private:
  int32_t pid_;
  std::shared_ptr<RuvoReportingServiceProtocol> object_;
  std::function<void()> interruption_;
  std::function<void()> invalidation_;
};

}  // namespace tavrin::testing
