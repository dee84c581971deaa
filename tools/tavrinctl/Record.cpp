#include "Record.h"

#include <unistd.h>

#include <fmt/format.h>

#include "Operations.h"

namespace tavrin::ctl {

CLI::App* AddRecordCommand(CLI::App& app, RecordOptions& options) {
  CLI::App* record = app.add_subcommand(
      "record", "record a session: create, start, send one message per stdin line, stop");
  record->add_option("--reporter,-r", options.reporter, "reporter ID (default: a random one)");
  record->add_option("--service-type,-s", options.serviceType,
                     "service type, a number or a name: generic, telephony, haptics, ...");
  record->add_option("--configuration", options.configuration,
                     "the session's configuration, a JSON object, e.g. "
                     "'{\"HostApplicationDisplayID\":\"player\"}'");
  record->add_option("--category,-c", options.category, "category of every message (default 1)");
  record->add_option("--type,-t", options.type, "type of every message (default 0)");
  record->footer(
      "Each non-blank line of stdin is one message payload, a JSON object such as "
      "{\"level\": 3}. A line that is not one ends the recording with an error naming it; the "
      "session is stopped either way, which writes its summary. Everything runs on one "
      "connection: the service stops a connection's sessions when it ends.");
  return record;
}

int RunRecord(const RecordOptions& options, const Context& context, std::FILE* in) {
  std::string error;
  client::Session::Options sessionOptions;
  sessionOptions.timeout = context.timeout;
  int64_t reporterID = 0;
  if (!options.reporter.empty()) {
    const auto parsed = ParseSigned(options.reporter);
    if (!parsed || *parsed == 0) {
      return Fail(kExitUsage, fmt::format("--reporter '{}' is not a reporter ID (a non-zero "
                                          "signed 64-bit integer)",
                                          options.reporter));
    }
    reporterID = *parsed;
  }
  if (!options.serviceType.empty()) {
    sessionOptions.serviceType = ParseServiceType(options.serviceType);
    if (!sessionOptions.serviceType) {
      return Fail(kExitUsage, fmt::format("--service-type '{}' is not a service type (0-65535 or "
                                          "a name such as generic, telephony, haptics)",
                                          options.serviceType));
    }
  }
  if (!options.configuration.empty()) {
    auto configuration = ParseJsonObject(options.configuration, &error);
    if (!configuration) return Fail(kExitUsage, "--configuration is " + error);
    sessionOptions.configuration = std::move(*configuration);
  }
  const auto category = ParseUnsigned(options.category, UINT32_MAX);
  if (!category) {
    return Fail(kExitUsage, fmt::format("--category '{}' is not a category (0 to 0xFFFFFFFF)",
                                        options.category));
  }
  const auto type = ParseUnsigned(options.type, UINT16_MAX);
  if (!type) {
    return Fail(kExitUsage, fmt::format("--type '{}' is not a type (0 to 65535)", options.type));
  }

  auto opened = Connection::Open(context);
  if (auto* status = std::get_if<int>(&opened)) return *status;
  Connection& connection = *std::get<std::unique_ptr<Connection>>(opened);
  auto session = client::Session::Open(connection.client(), reporterID, sessionOptions);
  if (!session) return ReportError(session.error(), context, "record");
  reporterID = session.value().reporterID();
  if (!context.json) {
    std::printf("reporter %lld: created, started\n", static_cast<long long>(reporterID));
    std::fflush(stdout);
  }
  if (::isatty(::fileno(in))) {
    std::fprintf(stderr, "tavrinctl: one JSON object per line; end with Ctrl-D\n");
  }

  int status = kExitOk;
  std::string failure;
  auto fail = [&](int code, std::string message) {
    status = code;
    failure = std::move(message);
    Fail(code, failure);
  };
  size_t sent = 0;
  size_t lineNumber = 0;
  std::string line;
  for (;;) {
    const LineStatus read = ReadBoundedLine(in, &line);
    if (read == LineStatus::kEnd) break;
    ++lineNumber;
    if (read == LineStatus::kTooLong) {
      fail(kExitFailed, fmt::format("stdin line {} is longer than {} bytes; nothing after line {} "
                                    "was sent",
                                    lineNumber, kMaxLineBytes, lineNumber - 1));
      break;
    }
    if (IsBlank(line)) continue;
    auto message = ParseJsonObject(line, &error);
    if (!message) {
      fail(kExitFailed,
           fmt::format("stdin line {} is {}; nothing from it on was sent", lineNumber, error));
      break;
    }
    auto accepted =
        session.value().send(*message, uint32_t(*category), uint16_t(*type), context.timeout);
    if (!accepted) {
      status = ReportError(accepted.error(), context,
                           fmt::format("record: the message of stdin line {}", lineNumber));
      failure = fmt::format("the message of stdin line {} was not accepted ({})", lineNumber,
                            client::ErrcName(accepted.error().code));
      break;
    }
    ++sent;
  }

  auto stopped = session.value().destroy();
  if (!stopped) {
    const int stopStatus = ReportError(stopped.error(), context, "record: stop");
    if (status == kExitOk) {
      status = stopStatus;
      failure =
          fmt::format("the session was not stopped ({})", client::ErrcName(stopped.error().code));
    }
  }
  if (context.json) {
    Json result = {{"operation", "record"}, {"reporterID", reporterID},
                   {"category", *category}, {"type", *type},
                   {"sent", sent},          {"stopped", stopped.ok()}};
    if (status != kExitOk) result["error"] = failure;
    PrintJsonLine(result);
  } else {
    std::printf("sent %zu message%s (category %llu, type %llu)\n", sent, sent == 1 ? "" : "s",
                static_cast<unsigned long long>(*category), static_cast<unsigned long long>(*type));
    if (stopped) std::printf("stopped %lld\n", static_cast<long long>(reporterID));
  }
  return status;
}

}  // namespace tavrin::ctl
