#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>

#include "protocol/RuvoReportingServiceProtocol.h"

namespace tavrin {

// One client's connection. Calls from the client arrive as calls on the exported object, on the
// connection's delivery thread.
class ClientConnection {
 public:
  virtual ~ClientConnection() = default;
  virtual int32_t ProcessIdentifier() const = 0;
  virtual uint32_t UserIdentifier() const = 0;
  virtual void SetExportedInterface(std::string_view interfaceName) = 0;
  virtual void SetExportedObject(std::shared_ptr<RuvoReportingServiceProtocol> object) = 0;
  virtual std::shared_ptr<RuvoReportingServiceProtocol> ExportedObject() const = 0;
  // Run when the connection ends abnormally (before the invalidation handler).
  virtual void SetInterruptionHandler(std::function<void()> handler) = 0;
  // Run exactly once when the connection ends, however it ends.
  virtual void SetInvalidationHandler(std::function<void()> handler) = 0;
  // Starts delivering the client's calls.
  virtual void Resume() = 0;
  // What "%@" prints for the connection.
  virtual std::string Description() const = 0;
};
using ClientConnectionPtr = std::shared_ptr<ClientConnection>;

class ServiceListener;

class ServiceListenerDelegate {
 public:
  virtual ~ServiceListenerDelegate() = default;
  // Called on the listener's thread for every new connection; false refuses it.
  virtual bool shouldAcceptNewConnection(ServiceListener& listener,
                                         const ClientConnectionPtr& connection) = 0;
};

// The service's listening endpoint.
class ServiceListener {
 public:
  virtual ~ServiceListener() = default;
  virtual void SetDelegate(ServiceListenerDelegate* delegate) = 0;
  // Runs the service loop on the calling thread; returns only when the loop is stopped.
  virtual void Resume() = 0;
};

}  // namespace tavrin
