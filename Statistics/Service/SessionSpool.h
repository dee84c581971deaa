#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "base/Dictionary.h"
#include "base/Error.h"
#include "platform/FileSystem.h"

namespace tavrin {

// What a started session has gathered, kept on disk as it arrives instead of in memory: its
// messages ({message id: payload}, which the summary file lists), the other records its summary
// aggregates, its user info and service type as they change, and pieces of summary texts that
// grew too long to keep in memory. A spool outlives a crash, which is how the summary of a
// session that was open when the service died is sent on the next start; a stopped session
// removes its spool once its summary is committed.
//
// The file is a sequence of records, each a 4-byte little-endian length and a MessagePack array
// whose first element names the record ("h" header, "m" message, "a" aggregated record,
// "u" user info, "t" service type, "k" text piece). Every append (or flush of buffered messages)
// is one write that reaches the file before it returns, so a process that dies loses at most the
// record it was writing, and a torn last record is ignored when reading. Thread-safe.
class SessionSpool {
 public:
  // A session's spool stops growing at its limit (and says so once): its summary file then lacks
  // the later messages, a recovered summary covers only what was spooled, and its long texts
  // stay in memory. The limit is the "limits.spool_bytes_per_session" setting.
  static constexpr uint64_t kDefaultByteLimit = uint64_t(256) << 20;
  static constexpr uint64_t kMinByteLimit = uint64_t(1) << 20;
  static constexpr unsigned kFileMode = 0640;
  static constexpr unsigned kDirectoryMode = 0750;
  static constexpr const char* kFileSuffix = ".spool";

  // A new spool in `directory` (which the service made at its start), named by the reporter,
  // `startedAt` (nanoseconds) and a counter of this process; the file is made at the first append.
  static std::shared_ptr<SessionSpool> Create(FileSystem& files, const std::string& directory,
                                              int64_t reporterID, int64_t startedAt,
                                              uint64_t byteLimit = kDefaultByteLimit);
  // A spool left by an earlier run of the service, for reading and removing.
  static std::shared_ptr<SessionSpool> Existing(FileSystem& files, std::string path);

  void AppendHeader(int64_t reporterID, uint16_t serviceType, const Dictionary& userInfo,
                    const Dictionary& messageTypeCounts);
  // Messages are buffered and written in one piece by FlushMessages, so that a burst costs one
  // write, not one per message; the session flushes before it hands the messages on.
  void BufferMessage(const std::string& messageId, const Dictionary& payload);
  size_t bufferedBytes() const;
  void FlushMessages();
  void AppendAggregated(const Dictionary& record);
  void AppendUserInfo(const Dictionary& userInfo);
  void AppendServiceType(uint16_t serviceType);
  // False when the piece could not be spooled (the caller keeps it).
  bool AppendTextPiece(size_t keyIndex, std::string_view text);

  // Every whole record, in order. Stops at the first record that does not decode.
  OptionalError Replay(const std::function<void(const Value& record)>& visit) const;
  void Remove();

  // Messages appended by this object (or, for an existing spool, counted by the caller).
  uint64_t messageCount() const;
  void setMessageCount(uint64_t count);
  const std::string& path() const { return path_; }

 private:
  SessionSpool(FileSystem& files, std::string directory, std::string path, uint64_t byteLimit);
  static std::string Encode(const Value& record);
  bool Append(const Value& record);
  bool WriteLocked(std::string_view bytes);

  FileSystem& files_;
  const std::string directory_;
  const std::string path_;
  const uint64_t byteLimit_;

  mutable std::mutex mutex_;
  std::unique_ptr<WritableFile> file_;  // guarded by mutex_; opened at the first append
  uint64_t bytes_ = 0;                  // guarded by mutex_
  uint64_t messageCount_ = 0;           // guarded by mutex_
  std::string buffer_;                  // guarded by mutex_
  uint64_t bufferedMessages_ = 0;       // guarded by mutex_
  bool failed_ = false;                 // guarded by mutex_; the first failure is logged
  bool opened_ = false;                 // guarded by mutex_
  bool removed_ = false;                // guarded by mutex_
};

}  // namespace tavrin
