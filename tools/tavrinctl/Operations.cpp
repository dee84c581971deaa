#include "Operations.h"

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <filesystem>
#include <thread>

#include <fmt/format.h>

#include "Statistics/RuvoReportingUtility.h"

namespace tavrin::ctl {
namespace {

// The one operation error the service has: the message path while reporting is disabled.
constexpr std::string_view kReportingErrorDomain = "com.quorvex.audio.reporting";
constexpr int64_t kReportingDisabledCode = 1;
constexpr uint16_t kNoServiceType = 0xFFFF;

std::string TimeoutText(std::chrono::milliseconds timeout) {
  if (timeout.count() % 1000 == 0) return fmt::format("{}s", timeout.count() / 1000);
  return fmt::format("{}ms", timeout.count());
}

std::string NotRunningMessage(const Context& context) {
  const std::string& socket = context.paths.socket;
  std::error_code ignored;
  const bool exists = std::filesystem::exists(socket, ignored);
  const std::string why =
      exists ? "nothing accepts connections on it: the service is not running, or it left a "
               "stale socket behind"
             : "the socket does not exist";
  return fmt::format(
      "no service at {} ({}). Start it with ./scripts/run.sh, or point --socket/TAVRIN_SOCKET "
      "(or --root/TAVRIN_ROOT) at its socket.",
      socket, why);
}

std::optional<int64_t> ReporterArgument(const std::string& text, std::string* error) {
  auto value = ParseSigned(text);
  if (!value) *error = fmt::format("'{}' is not a reporter ID (a signed 64-bit integer)", text);
  return value;
}

}  // namespace

void PrintJsonLine(const Json& value) {
  const std::string text = value.dump(-1, ' ', false, Json::error_handler_t::replace);
  std::fwrite(text.data(), 1, text.size(), stdout);
  std::fputc('\n', stdout);
}

int ReportError(const client::Error& error, const Context& context, std::string_view operation) {
  const std::string& socket = context.paths.socket;
  using client::Errc;
  switch (error.code) {
    case Errc::kNotRunning:
      return Fail(kExitUnreachable, NotRunningMessage(context));
    case Errc::kPermissionDenied:
      return Fail(kExitUnreachable,
                  fmt::format("may not connect to the service at {} (permission denied). The "
                              "socket's mode is tavrind's --socket-mode; run tavrinctl as a user "
                              "who may write to it.",
                              socket));
    case Errc::kConnectionLost:
      return Fail(kExitUnreachable,
                  fmt::format("{}: the connection to the service at {} ended (the service stopped "
                              "or was killed). Check that it runs (./scripts/run.sh) and retry.",
                              operation, socket));
    case Errc::kTimedOut:
      return Fail(kExitTimedOut,
                  fmt::format("{}: no answer from the service at {} within {}. It may be busy or "
                              "stuck; retry with a longer --timeout.",
                              operation, socket, TimeoutText(context.timeout)));
    case Errc::kOperationError:
      if (error.domain == kReportingErrorDomain && error.serviceCode == kReportingDisabledCode) {
        return Fail(kExitFailed,
                    fmt::format("{}: the service refused the message: reporting is disabled ({} "
                                "error {}). Turn it back on with: tavrinctl defaults delete "
                                "disable_reporting",
                                operation, error.domain, error.serviceCode));
      }
      return Fail(kExitFailed,
                  fmt::format("{}: the service answered {} error {}{}{}", operation, error.domain,
                              error.serviceCode, error.message.empty() ? "" : ": ", error.message));
    case Errc::kRejected:
      return Fail(kExitFailed,
                  fmt::format("{}: the service did not understand the request ({} error {}: {}). "
                              "tavrinctl and tavrind may come from different versions.",
                              operation, error.domain, error.serviceCode, error.message));
    case Errc::kNoReply:
      return Fail(kExitFailed, fmt::format("{}: the service dropped the request without an "
                                           "answer: {}",
                                           operation, error.message));
    case Errc::kBadReply:
      return Fail(kExitFailed, fmt::format("{}: the service's answer cannot be read: {}", operation,
                                           error.message));
    case Errc::kInvalidArgument:
      return Fail(kExitFailed,
                  fmt::format("{}: the request cannot be sent: {}", operation, error.message));
    case Errc::kWouldDeadlock:
      break;
  }
  return Fail(kExitFailed,
              fmt::format("{}: {} ({})", operation, error.message, client::ErrcName(error.code)));
}

std::string ServiceTypeText(uint16_t serviceType) {
  if (auto name = ServiceTypeName(serviceType)) return fmt::format("{} ({})", serviceType, *name);
  return std::to_string(serviceType);
}

std::optional<uint16_t> ParseServiceType(std::string_view text) {
  if (auto number = ParseUnsigned(text, UINT16_MAX)) return uint16_t(*number);
  // Named codes are 0 up to the first without a name, and 0xFFFF.
  for (uint16_t code = 0;; ++code) {
    const auto name = ServiceTypeName(code);
    if (!name) break;
    if (*name == text) return code;
  }
  if (ServiceTypeName(kNoServiceType) == text) return kNoServiceType;
  return std::nullopt;
}

std::optional<client::Dictionary> ParseJsonObject(std::string_view text, std::string* error) {
  client::Dictionary value;
  try {
    value = client::Dictionary::parse(text);
  } catch (const client::Dictionary::parse_error& failure) {
    // what() starts with "[json.exception.parse_error.101] ", which says nothing to a user.
    std::string_view reason = failure.what();
    if (const size_t end = reason.find("] "); end != std::string_view::npos) {
      reason.remove_prefix(end + 2);
    }
    *error = fmt::format("not JSON ({})", reason);
    return std::nullopt;
  }
  if (!value.is_object()) {
    *error = fmt::format("a JSON {}, not an object ({{\"key\": value, ...}})", value.type_name());
    return std::nullopt;
  }
  return value;
}

// ---------------------------------------------------------------------------------------------
// Connection

struct Connection::HeldStart {
  bool roundTripDone = false;                           // guarded by Connection::mutex_
  std::optional<client::Result<bool>> immediateAnswer;  // guarded by Connection::mutex_
};

std::variant<std::unique_ptr<Connection>, int> Connection::Open(const Context& context) {
  client::ConnectOptions options;
  options.socketPath = context.paths.socket;
  options.timeout = context.timeout;
  auto connected = client::Client::Connect(options);
  if (!connected) return ReportError(connected.error(), context, "connect");
  return std::unique_ptr<Connection>(new Connection(std::move(connected.value())));
}

Connection::~Connection() {
  // Close() invokes the handlers still waiting, which take mutex_ and touch the maps.
  client_->Close();
}

std::optional<client::Result<bool>> Connection::Start(int64_t reporterID, const Context& context) {
  auto state = std::make_shared<HeldStart>();
  const bool json = context.json;
  client_->startReportingSessionForID(
      reporterID, [this, state, reporterID, json](client::Result<bool> answer) {
        std::lock_guard lock(mutex_);
        if (!state->roundTripDone) {
          state->immediateAnswer = std::move(answer);
          return;
        }
        const auto held = heldStarts_.find(reporterID);
        if (held != heldStarts_.end() && held->second == state) heldStarts_.erase(held);
        if (answer.ok()) {
          notes_.push_back(json ? Json({{"operation", "start"},
                                        {"reporterID", reporterID},
                                        {"answer", answer.value()},
                                        {"answeredAtStop", true}})
                                      .dump()
                                : fmt::format("the start of {} was answered {} (its session "
                                              "stopped)",
                                              reporterID, answer.value()));
        } else if (answer.error().code == client::Errc::kNoReply) {
          notes_.push_back(json ? Json({{"operation", "start"},
                                        {"reporterID", reporterID},
                                        {"answer", nullptr},
                                        {"dropped", true}})
                                      .dump()
                                : fmt::format("the start of {} will never be answered: its session "
                                              "went away (destroyed, or replaced by a new create)",
                                              reporterID));
        }
      });
  // Requests are answered in order: once this query is answered, an immediate answer to the
  // start has come in too, and a start with none is held.
  auto roundTrip = client_->getAllReporters(context.timeout);
  std::lock_guard lock(mutex_);
  state->roundTripDone = true;
  if (state->immediateAnswer) return std::move(*state->immediateAnswer);
  if (!roundTrip) return client::Result<bool>(roundTrip.error());
  heldStarts_[reporterID] = state;
  return std::nullopt;
}

void Connection::NoteCreated(int64_t reporterID) {
  std::lock_guard lock(mutex_);
  if (std::find(created_.begin(), created_.end(), reporterID) == created_.end()) {
    created_.push_back(reporterID);
  }
}

void Connection::NoteDestroyed(int64_t reporterID) {
  std::lock_guard lock(mutex_);
  created_.erase(std::remove(created_.begin(), created_.end(), reporterID), created_.end());
}

std::vector<int64_t> Connection::RunningOwnSessions() const {
  std::lock_guard lock(mutex_);
  std::vector<int64_t> running;
  for (int64_t reporterID : created_) {
    if (heldStarts_.count(reporterID) != 0) running.push_back(reporterID);
  }
  return running;
}

std::vector<std::string> Connection::TakeNotes() {
  std::lock_guard lock(mutex_);
  return std::exchange(notes_, {});
}

// ---------------------------------------------------------------------------------------------
// OperationCommands

void OperationCommands::AddTo(CLI::App& app, bool oneShot) {
  auto add = [&](const char* name, const char* description, Operation operation) {
    CLI::App* command = app.add_subcommand(name, description);
    commands_.emplace_back(command, operation);
    return command;
  };
  // Sessions belong to the connection that created them; a command's connection ends with it.
  const char* ownNote =
      oneShot ? "Only sessions created on the same connection are found, and this command's "
                "connection ends with it: use 'record' or 'shell' to create, start and stop a "
                "session on one connection."
              : "";

  auto* create = add("create",
                     oneShot ? "create a session (random ID unless given); it ends with this "
                               "command"
                             : "create a session (random ID unless given) on this connection",
                     Operation::kCreate);
  create->add_option("ID", reporter_, "reporter ID");

  auto* setType =
      add("set-type", "set the service type of a session of this connection", Operation::kSetType);
  setType->add_option("ID", reporter_, "reporter ID")->required();
  setType->add_option("TYPE", serviceType_, "a number or a name: generic, telephony, haptics, ...")
      ->required();
  setType->footer(ownNote);

  auto* getType =
      add("get-type", "print the service type of a session of any connection", Operation::kGetType);
  getType->add_option("ID", reporter_, "reporter ID")->required();

  auto* configure = add("configure", "give a session of this connection its configuration (JSON)",
                        Operation::kConfigure);
  configure->add_option("ID", reporter_, "reporter ID")->required();
  configure
      ->add_option("JSON", json_, "a JSON object, e.g. '{\"HostApplicationDisplayID\":\"player\"}'")
      ->required();
  configure->footer(ownNote);

  auto* start =
      add("start", "start a session; its answer comes when the session stops", Operation::kStart);
  start->add_option("ID", reporter_, "reporter ID")->required();

  auto* send =
      add("send", "send a message (JSON object) to --to IDs, else to every running session",
          Operation::kSend);
  send->add_option("JSON", json_, "the payload, a JSON object, e.g. '{\"level\": 3}'")->required();
  send->add_option("--category,-c", category_, "category (default 1)");
  send->add_option("--type,-t", type_, "type (default 0)");
  send->add_option("--to", to_, "reporter IDs to send to (repeat, or separate with commas)")
      ->delimiter(',');

  auto* stop =
      add("stop", "stop a session of this connection: its summary is written", Operation::kStop);
  stop->add_option("ID", reporter_, "reporter ID")->required();
  stop->footer(ownNote);

  auto* destroy =
      add("destroy", "stop and remove a session of this connection", Operation::kDestroy);
  destroy->add_option("ID", reporter_, "reporter ID")->required();
  destroy->footer(ownNote);

  auto* valid = add("valid", "whether some connection holds a session under ID, and its type",
                    Operation::kValid);
  valid->add_option("ID", reporter_, "reporter ID")->required();

  add("reporters", "list the reporter IDs of every connection's sessions", Operation::kReporters);
  add("kill", "end the service process at once (exit status 2); sessions are not stopped",
      Operation::kKill);
  auto* status = add("status",
                     "the service's counts: every client's messages received, delivered, in "
                     "flight and dropped by reason",
                     Operation::kStatus);
  status->add_flag("--watch,-w", watch_, "refresh once a second until interrupted");
}

bool OperationCommands::Selected() const {
  return std::any_of(commands_.begin(), commands_.end(),
                     [](const auto& command) { return command.first->parsed(); });
}

int OperationCommands::Prepare() {
  const auto chosen = std::find_if(commands_.begin(), commands_.end(),
                                   [](const auto& command) { return command.first->parsed(); });
  if (chosen == commands_.end()) return Fail(kExitUsage, "no operation given");
  Request request;
  request.operation = chosen->second;
  const Operation operation = request.operation;
  std::string error;

  const bool needsReporter = operation != Operation::kSend && operation != Operation::kReporters &&
                             operation != Operation::kKill && operation != Operation::kStatus;
  if (needsReporter) {
    if (operation == Operation::kCreate && reporter_.empty()) {
      request.reporterID = client::NewReporterID();
    } else if (auto parsed = ReporterArgument(reporter_, &error)) {
      request.reporterID = *parsed;
    } else {
      return Fail(kExitUsage, error);
    }
  }
  if (operation == Operation::kSetType) {
    const auto serviceType = ParseServiceType(serviceType_);
    if (!serviceType) {
      return Fail(kExitUsage, fmt::format("'{}' is not a service type (0-65535 or a name such "
                                          "as generic, telephony, haptics)",
                                          serviceType_));
    }
    request.serviceType = *serviceType;
  }
  if (operation == Operation::kConfigure || operation == Operation::kSend) {
    auto object = ParseJsonObject(json_, &error);
    if (!object) {
      return Fail(kExitUsage, operation == Operation::kSend
                                  ? "send: the message is " + error
                                  : "configure: the configuration is " + error);
    }
    request.json = std::move(*object);
  }
  if (operation == Operation::kSend) {
    const auto category = ParseUnsigned(category_, UINT32_MAX);
    if (!category) {
      return Fail(kExitUsage, fmt::format("'{}' is not a category (0 to 0xFFFFFFFF)", category_));
    }
    const auto type = ParseUnsigned(type_, UINT16_MAX);
    if (!type) return Fail(kExitUsage, fmt::format("'{}' is not a type (0 to 65535)", type_));
    request.category = uint32_t(*category);
    request.type = uint16_t(*type);
    if (!to_.empty()) {
      request.to.emplace();
      for (const std::string& text : to_) {
        auto id = ReporterArgument(text, &error);
        if (!id) return Fail(kExitUsage, error);
        request.to->push_back(*id);
      }
    }
  }
  request_ = std::move(request);
  return kExitOk;
}

int OperationCommands::Run(Connection& connection, const Context& context) {
  if (!request_) {
    if (const int status = Prepare(); status != kExitOk) return status;
  }
  return Execute(*request_, connection, context);
}

int OperationCommands::Execute(const Request& request, Connection& connection,
                               const Context& context) {
  client::Client& client = connection.client();
  const auto timeout = context.timeout;
  const int64_t reporterID = request.reporterID;

  // Operations answered with a plain boolean, which the service sends as true in every case.
  auto printAnswer = [&](const char* name, client::Result<bool> answer,
                         Json extra = Json::object()) {
    if (!answer) return ReportError(answer.error(), context, name);
    if (context.json) {
      Json line = {{"operation", name}, {"reporterID", reporterID}};
      for (auto& [key, value] : extra.items()) line[key] = value;
      line["answer"] = answer.value();
      PrintJsonLine(line);
    } else {
      std::printf("%s %lld: %s\n", name, static_cast<long long>(reporterID),
                  answer.value() ? "true" : "false");
    }
    return kExitOk;
  };

  switch (request.operation) {
    case Operation::kCreate: {
      auto answer = client.createReportingSession(reporterID, timeout);
      if (!answer) return ReportError(answer.error(), context, "create");
      connection.NoteCreated(reporterID);
      if (context.json) {
        PrintJsonLine(
            {{"operation", "create"}, {"reporterID", reporterID}, {"answer", answer.value()}});
      } else {
        std::printf("created session %lld\n", static_cast<long long>(reporterID));
      }
      return kExitOk;
    }
    case Operation::kSetType:
      return printAnswer("set-type",
                         client.setServiceType(request.serviceType, reporterID, timeout),
                         {{"serviceType", request.serviceType}});
    case Operation::kGetType: {
      auto answer = client.getServiceNameForReporterID(reporterID, timeout);
      if (!answer) return ReportError(answer.error(), context, "get-type");
      const uint16_t serviceType = answer.value();
      if (context.json) {
        const auto name = ServiceTypeName(serviceType);
        PrintJsonLine({{"operation", "get-type"},
                       {"reporterID", reporterID},
                       {"serviceType", serviceType},
                       {"name", name ? Json(*name) : Json()}});
      } else if (serviceType == kNoServiceType) {
        std::printf("%lld: %s: no session holds this ID, or its type was never set\n",
                    static_cast<long long>(reporterID), ServiceTypeText(serviceType).c_str());
      } else {
        std::printf("%lld: %s\n", static_cast<long long>(reporterID),
                    ServiceTypeText(serviceType).c_str());
      }
      return kExitOk;
    }
    case Operation::kConfigure:
      return printAnswer("configure", client.setConfiguration(request.json, reporterID, timeout));
    case Operation::kStart: {
      auto answer = connection.Start(reporterID, context);
      if (answer && !*answer) return ReportError(answer->error(), context, "start");
      if (context.json) {
        PrintJsonLine({{"operation", "start"},
                       {"reporterID", reporterID},
                       {"held", !answer},
                       {"answer", answer ? Json(answer->value()) : Json()}});
      } else if (answer) {
        std::printf(
            "start %lld: %s (nothing was started: no session holds this ID, or it was "
            "running already)\n",
            static_cast<long long>(reporterID), answer->value() ? "true" : "false");
      } else {
        std::printf("started %lld; the service answers this start when the session stops\n",
                    static_cast<long long>(reporterID));
      }
      return kExitOk;
    }
    case Operation::kSend: {
      const auto& to = request.to;
      auto answer = client.sendMessage(request.json, request.category, request.type, to, timeout);
      if (!answer) return ReportError(answer.error(), context, "send");
      if (context.json) {
        PrintJsonLine({{"operation", "send"},
                       {"category", request.category},
                       {"type", request.type},
                       {"to", to ? Json(*to) : Json()},
                       {"accepted", true}});
      } else if (to) {
        std::printf("sent to %s: accepted\n", fmt::format("{}", fmt::join(*to, ", ")).c_str());
      } else {
        std::printf("sent to every running session (standalone when none runs): accepted\n");
      }
      return kExitOk;
    }
    case Operation::kStop:
      return printAnswer("stop", client.stopReportingSessionForID(reporterID, timeout));
    case Operation::kDestroy: {
      auto answer = client.destroyReportingSession(reporterID, timeout);
      if (answer) connection.NoteDestroyed(reporterID);
      return printAnswer("destroy", std::move(answer));
    }
    case Operation::kValid: {
      auto answer = client.reporterID(reporterID, timeout);
      if (!answer) return ReportError(answer.error(), context, "valid");
      const bool valid = answer.value().reporterID != 0;
      if (context.json) {
        PrintJsonLine({{"operation", "valid"},
                       {"reporterID", reporterID},
                       {"valid", valid},
                       {"serviceType", answer.value().serviceType}});
      } else if (valid) {
        std::printf("%lld: valid, service type %s\n", static_cast<long long>(reporterID),
                    ServiceTypeText(answer.value().serviceType).c_str());
      } else {
        std::printf("%lld: no session holds this ID\n", static_cast<long long>(reporterID));
      }
      return kExitOk;
    }
    case Operation::kReporters: {
      auto answer = client.getAllReporters(timeout);
      if (!answer) return ReportError(answer.error(), context, "reporters");
      if (context.json) {
        PrintJsonLine({{"operation", "reporters"}, {"reporterIDs", answer.value()}});
      } else {
        for (int64_t id : answer.value()) std::printf("%lld\n", static_cast<long long>(id));
      }
      return kExitOk;
    }
    case Operation::kStatus: {
      for (;;) {
        auto answer = client.status(timeout);
        if (!answer) return ReportError(answer.error(), context, "status");
        if (context.json) {
          PrintJsonLine({{"operation", "status"}, {"status", answer.value()}});
        } else {
          std::printf("%s%s", watch_ ? "\n" : "", StatusTable(answer.value()).c_str());
        }
        std::fflush(stdout);
        if (!watch_) return kExitOk;
        std::this_thread::sleep_for(std::chrono::seconds(1));
      }
    }
    case Operation::kKill: {
      auto answer = client.killService(timeout);
      if (!answer) return ReportError(answer.error(), context, "kill");
      if (context.json) {
        PrintJsonLine({{"operation", "kill"}, {"ended", true}});
      } else {
        std::printf("the service ended\n");
      }
      return kExitOk;
    }
  }
  return Fail(kExitUsage, "unknown operation");
}

std::string StatusTable(const client::Dictionary& status) {
  auto count = [](const client::Dictionary& object, const char* key) -> uint64_t {
    const auto found = object.find(key);
    return found != object.end() && found->is_number_unsigned() ? found->get<uint64_t>() : 0;
  };
  auto row = [&](const std::string& who, const client::Dictionary& counts) {
    std::string dropped;
    uint64_t droppedTotal = 0;
    if (const auto reasons = counts.find("dropped"); reasons != counts.end()) {
      for (const auto& [reason, n] : reasons->items()) {
        if (!n.is_number_unsigned()) continue;
        droppedTotal += n.get<uint64_t>();
        dropped += fmt::format("{}{} {}", dropped.empty() ? " (" : ", ", reason, n.get<uint64_t>());
      }
    }
    if (!dropped.empty()) dropped += ")";
    return fmt::format("{:<28} {:>10} {:>10} {:>10} {:>10}{}\n", who, count(counts, "received"),
                       count(counts, "delivered"), count(counts, "in_flight"), droppedTotal,
                       dropped);
  };
  const auto number = [&](const char* key) {
    const auto found = status.find(key);
    return found != status.end() && found->is_number() ? found->get<double>() : 0.0;
  };
  std::string text = fmt::format(
      "up {:.0f} s, {:.1f} MiB resident, {} sessions, {} records waiting for the back-ends, {} "
      "queued work items\n",
      number("uptime_s"), number("rss_bytes") / (1024 * 1024), count(status, "sessions"),
      count(status, "store_backlog"), count(status, "queued_work_items"));
  text += fmt::format("{:<28} {:>10} {:>10} {:>10} {:>10}\n", "messages", "received", "delivered",
                      "in flight", "dropped");
  if (const auto totals = status.find("totals"); totals != status.end() && totals->is_object()) {
    text += row("all clients", *totals);
  }
  if (const auto clients = status.find("clients"); clients != status.end() && clients->is_array()) {
    for (const auto& client : *clients) {
      if (!client.is_object()) continue;
      const std::string name = client.value("name", std::string());
      text += row(fmt::format("pid {} uid {} {}", client.value("pid", 0), client.value("uid", 0),
                              name.empty() ? "?" : name),
                  client);
    }
  }
  return text;
}

}  // namespace tavrin::ctl
