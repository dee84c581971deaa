// Opens a reporting session, reports a few measurements and stops it: the summary is written and
// the messages are committed to the service's store when the session ends.
//
//   report_xruns [SOCKET]     (default: $TAVRIN_SOCKET, then $TAVRIN_ROOT/run/reporting.sock,
//                              then /run/tavrin/reporting.sock)

#include <tavrin/Client.h>

#include <cstdio>

int main(int argc, char** argv) {
  using namespace tavrin::client;

  auto connected = Client::Connect({argc > 1 ? argv[1] : ""});
  if (!connected) {
    std::fprintf(stderr, "report_xruns: %s\n", connected.error().message.c_str());
    return 1;
  }
  Client& client = *connected.value();

  Session::Options options;
  options.serviceType = 3;
  options.configuration = {{"route", "speaker"}, {"sample_rate", 48000}};
  auto opened = Session::Open(client, NewReporterID(), options);
  if (!opened) {
    std::fprintf(stderr, "report_xruns: %s\n", opened.error().message.c_str());
    return 1;
  }
  Session& session = opened.value();

  constexpr uint32_t kCategory = 2;
  constexpr uint16_t kType = 1;
  for (int period = 0; period < 3; ++period) {
    // Fire-and-forget: returns once the message is on its way.
    if (auto sent = session.send({{"xruns", period}, {"period", period}}, kCategory, kType);
        !sent) {
      std::fprintf(stderr, "report_xruns: %s\n", sent.error().message.c_str());
      return 1;
    }
  }
  // The last one waits for the service's answer, so a refusal (reporting disabled) shows here.
  if (auto sent = session.send({{"xruns", 0}, {"period", 3}}, kCategory, kType, kDefaultTimeout);
      !sent) {
    std::fprintf(stderr, "report_xruns: %s\n", sent.error().message.c_str());
    return 1;
  }
  if (auto stopped = session.stop(); !stopped) {
    std::fprintf(stderr, "report_xruns: %s\n", stopped.error().message.c_str());
    return 1;
  }
  std::printf("reported 4 messages as reporter %lld\n",
              static_cast<long long>(session.reporterID()));
  return 0;  // the session is destroyed when it goes out of scope
}
