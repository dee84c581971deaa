#pragma once

// The service's remote operations as tavrinctl subcommands, over one connection that a single
// command or a whole shell session uses.

#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include <CLI/CLI.hpp>
#include <nlohmann/json.hpp>

#include "Common.h"
#include "tavrin/Client.h"

namespace tavrin::ctl {

// The answer of the status operation as a person reads it: one line of the service's counts,
// then a table of messages (received, delivered, in flight, dropped by reason) in total and per
// connected client.
std::string StatusTable(const client::Dictionary& status);

using Json = nlohmann::ordered_json;

// One line of JSON on stdout. Invalid UTF-8 from the store or a file is replaced, not fatal.
void PrintJsonLine(const Json& value);

// The error of a failed call as a message that says what to do, on stderr; answers the exit
// status that goes with it. `operation` names what was being done ("connect", "send").
int ReportError(const client::Error& error, const Context& context, std::string_view operation);

// "3 (haptics)", "13" for codes without a name.
std::string ServiceTypeText(uint16_t serviceType);
// A service type given as a number or a name ("3", "haptics").
std::optional<uint16_t> ParseServiceType(std::string_view text);
// A JSON object (message payload, configuration); `error` says why not.
std::optional<client::Dictionary> ParseJsonObject(std::string_view text, std::string* error);

// One connection to the service, and what it learns from answers that arrive after their
// command ended: a start's answer is held by the service until the session stops.
class Connection {
 public:
  // Connects, or prints why not and answers the exit status.
  static std::variant<std::unique_ptr<Connection>, int> Open(const Context& context);
  // Closes the connection before the state that its late answers update goes away.
  ~Connection();
  Connection(const Connection&) = delete;
  Connection& operator=(const Connection&) = delete;

  client::Client& client() { return *client_; }

  // Starts `reporterID` without waiting for the held answer. Answers nullopt when the start was
  // held (the session was started now and answers at its stop), else the immediate answer.
  std::optional<client::Result<bool>> Start(int64_t reporterID, const Context& context);
  void NoteCreated(int64_t reporterID);
  void NoteDestroyed(int64_t reporterID);
  // Sessions created on this connection whose start is held: they run until stopped.
  std::vector<int64_t> RunningOwnSessions() const;
  // Lines about answers that came in since the last call (held starts answered by a stop).
  std::vector<std::string> TakeNotes();

 private:
  explicit Connection(std::unique_ptr<client::Client> client) : client_(std::move(client)) {}

  struct HeldStart;
  std::unique_ptr<client::Client> client_;
  mutable std::mutex mutex_;
  std::map<int64_t, std::shared_ptr<HeldStart>> heldStarts_;  // guarded by mutex_
  std::vector<int64_t> created_;                              // guarded by mutex_
  std::vector<std::string> notes_;                            // guarded by mutex_
};

// The eleven operations as subcommands of a CLI11 app. Used for the command line and, afresh
// for each line, by the shell.
class OperationCommands {
 public:
  // `oneShot`: the commands run on a connection that ends with them, which the help says.
  void AddTo(CLI::App& app, bool oneShot);
  // Whether one of them was chosen by the last parse.
  bool Selected() const;
  // Checks the chosen one's arguments, so that a usage error is reported before connecting.
  // Answers the exit status of that error, or 0.
  int Prepare();
  // Runs the chosen one (after Prepare) and answers the exit status.
  int Run(Connection& connection, const Context& context);

 private:
  enum class Operation {
    kCreate,
    kSetType,
    kGetType,
    kConfigure,
    kStart,
    kSend,
    kStop,
    kDestroy,
    kValid,
    kReporters,
    kKill,
    kStatus
  };
  // The chosen operation with its arguments checked and converted.
  struct Request {
    Operation operation = Operation::kReporters;
    int64_t reporterID = 0;
    uint16_t serviceType = 0;
    client::Dictionary json;
    uint32_t category = 0;
    uint16_t type = 0;
    std::optional<std::vector<int64_t>> to;
  };
  int Execute(const Request& request, Connection& connection, const Context& context);

  std::optional<Request> request_;
  std::vector<std::pair<CLI::App*, Operation>> commands_;
  std::string reporter_;
  std::string serviceType_;
  std::string json_;
  bool watch_ = false;
  std::string category_ = "1";
  std::string type_ = "0";
  std::vector<std::string> to_;
};

}  // namespace tavrin::ctl
