#include "protocol/Dispatch.h"

#include <type_traits>
#include <utility>
#include <variant>

namespace tavrin::protocol {
namespace {

// A reply callback for `call`: encodes its argument with `encode` and sends it; sends nothing
// when the call is nil.
template <typename Arg, typename Encode>
std::function<void(Arg)> Replier(std::optional<uint64_t> call, const ReplySender& send,
                                 Encode encode) {
  if (!call) return [](Arg) {};
  return [call = *call, send, encode](Arg value) { send(encode(call, value)); };
}

}  // namespace

void Dispatch(Request request, RuvoReportingServiceProtocol& service, ReplySender send) {
  using Protocol = RuvoReportingServiceProtocol;
  const std::optional<uint64_t> call = request.call;
  auto boolReply = [&] { return Replier<bool>(call, send, EncodeBoolReply); };
  std::visit(
      [&](auto&& args) {
        using T = std::decay_t<decltype(args)>;
        if constexpr (std::is_same_v<T, CreateReportingSession>) {
          service.createReportingSession(args.reporterID, boolReply());
        } else if constexpr (std::is_same_v<T, SetServiceType>) {
          service.setServiceType(args.serviceType, args.reporterID, boolReply());
        } else if constexpr (std::is_same_v<T, GetServiceNameForReporterID>) {
          service.getServiceNameForReporterID(
              args.reporterID, Replier<uint16_t>(call, send, EncodeServiceTypeReply));
        } else if constexpr (std::is_same_v<T, SetConfiguration>) {
          service.setConfiguration(args.configuration, args.reporterID, boolReply());
        } else if constexpr (std::is_same_v<T, StartReportingSessionForID>) {
          service.startReportingSessionForID(args.reporterID, boolReply());
        } else if constexpr (std::is_same_v<T, SendMessage>) {
          Protocol::ErrorReply reply =
              Replier<const OptionalError&>(call, send, [](uint64_t c, const OptionalError& error) {
                return error ? EncodeOperationErrorReply(c, error->domain, error->code)
                             : EncodeNilReply(c);
              });
          service.sendMessage(std::move(args.message), args.category, args.type, args.reporterIDs,
                              std::move(reply));
        } else if constexpr (std::is_same_v<T, StopReportingSessionForID>) {
          service.stopReportingSessionForID(args.reporterID, boolReply());
        } else if constexpr (std::is_same_v<T, DestroyReportingSession>) {
          service.destroyReportingSession(args.reporterID, boolReply());
        } else if constexpr (std::is_same_v<T, ReporterIDValid>) {
          service.reporterID(args.reporterID,
                             Replier<const Dictionary&>(call, send, EncodeDictionaryReply));
        } else if constexpr (std::is_same_v<T, GetAllReporters>) {
          service.getAllReporters(Replier<const std::vector<int64_t>&>(
              call, send, [](uint64_t c, const std::vector<int64_t>& ids) {
                return EncodeReportersReply(c, ids);
              }));
        } else if constexpr (std::is_same_v<T, KillService>) {
          service.killService(boolReply());
        } else {
          // The listener answers status with what it alone can read; a service reached any
          // other way has none to give.
          static_assert(std::is_same_v<T, GetStatus>);
          if (call) {
            send(EncodeOperationErrorReply(*call, kProtocolErrorDomain, 1,
                                           "status is answered by the service's listener"));
          }
        }
      },
      request.arguments);
}

}  // namespace tavrin::protocol
