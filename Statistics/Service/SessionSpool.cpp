#include "Statistics/Service/SessionSpool.h"

#include <atomic>
#include <utility>

#include "Statistics/Service/RuvoReportingSession.h"
#include "platform/LogSystem.h"

namespace tavrin {
namespace {

constexpr size_t kLengthBytes = 4;
constexpr size_t kReadBytes = 64 * 1024;

std::string LengthPrefix(size_t length) {
  std::string prefix(kLengthBytes, '\0');
  for (size_t i = 0; i < kLengthBytes; ++i) prefix[i] = char((length >> (8 * i)) & 0xFF);
  return prefix;
}

size_t PrefixLength(std::string_view bytes) {
  size_t length = 0;
  for (size_t i = 0; i < kLengthBytes; ++i) length |= size_t(uint8_t(bytes[i])) << (8 * i);
  return length;
}

}  // namespace

std::shared_ptr<SessionSpool> SessionSpool::Create(FileSystem& files, const std::string& directory,
                                                   int64_t reporterID, int64_t startedAt,
                                                   uint64_t byteLimit) {
  static std::atomic<uint64_t> counter{0};
  std::string path = fmt::format("{}/{}-{}-{}{}", directory, reporterID, startedAt,
                                 counter.fetch_add(1), kFileSuffix);
  return std::shared_ptr<SessionSpool>(
      new SessionSpool(files, directory, std::move(path), byteLimit));
}

std::shared_ptr<SessionSpool> SessionSpool::Existing(FileSystem& files, std::string path) {
  auto spool = std::shared_ptr<SessionSpool>(
      new SessionSpool(files, std::string(), std::move(path), kDefaultByteLimit));
  // Nothing more is appended to it.
  spool->failed_ = true;
  return spool;
}

SessionSpool::SessionSpool(FileSystem& files, std::string directory, std::string path,
                           uint64_t byteLimit)
    : files_(files),
      directory_(std::move(directory)),
      path_(std::move(path)),
      byteLimit_(byteLimit) {}

void SessionSpool::AppendHeader(int64_t reporterID, uint16_t serviceType,
                                const Dictionary& userInfo, const Dictionary& messageTypeCounts) {
  Append(Value::array({"h", reporterID, serviceType, userInfo, messageTypeCounts}));
}

void SessionSpool::BufferMessage(const std::string& messageId, const Dictionary& payload) {
  // The record ["m", id, payload] is encoded piece by piece: building it as one value would copy
  // every payload.
  constexpr char kThreeElementArray = char(0x93);
  std::string bytes = LengthPrefix(0);
  bytes.push_back(kThreeElementArray);
  Value::to_msgpack(Value("m"), bytes);
  Value::to_msgpack(Value(messageId), bytes);
  Value::to_msgpack(payload, bytes);
  bytes.replace(0, kLengthBytes, LengthPrefix(bytes.size() - kLengthBytes));
  std::lock_guard lock(mutex_);
  buffer_ += bytes;
  ++bufferedMessages_;
}

size_t SessionSpool::bufferedBytes() const {
  std::lock_guard lock(mutex_);
  return buffer_.size();
}

void SessionSpool::FlushMessages() {
  std::lock_guard lock(mutex_);
  if (buffer_.empty()) return;
  if (WriteLocked(buffer_)) messageCount_ += bufferedMessages_;
  buffer_.clear();
  bufferedMessages_ = 0;
}

void SessionSpool::AppendAggregated(const Dictionary& record) {
  Append(Value::array({"a", record}));
}

void SessionSpool::AppendUserInfo(const Dictionary& userInfo) {
  Append(Value::array({"u", userInfo}));
}

void SessionSpool::AppendServiceType(uint16_t serviceType) {
  Append(Value::array({"t", serviceType}));
}

bool SessionSpool::AppendTextPiece(size_t keyIndex, std::string_view text) {
  return Append(Value::array({"k", keyIndex, std::string(text)}));
}

std::string SessionSpool::Encode(const Value& record) {
  std::string bytes = LengthPrefix(0);
  Value::to_msgpack(record, bytes);
  const size_t length = bytes.size() - kLengthBytes;
  bytes.replace(0, kLengthBytes, LengthPrefix(length));
  return bytes;
}

bool SessionSpool::Append(const Value& record) {
  const std::string bytes = Encode(record);
  std::lock_guard lock(mutex_);
  return WriteLocked(bytes);
}

bool SessionSpool::WriteLocked(std::string_view bytes) {
  if (failed_ || removed_) return false;
  OptionalError error;
  if (bytes_ + bytes.size() > byteLimit_) {
    error = Error{kGeneralErrorDomain, -1,
                  fmt::format("the spool is full at {} bytes (limits.spool_bytes_per_session); "
                              "later records are left out",
                              bytes_)};
  } else if (!file_) {
    file_ = files_.OpenForAppend(path_, kFileMode, &error);
    opened_ = file_ != nullptr;
  }
  if (!error) error = file_->Append(bytes);
  if (error) {
    failed_ = true;
    file_.reset();
    TLOG_ERROR(RuvoReportingSession::SessionLog(), "spool {}: {}", path_,
               error->LocalizedDescription());
    return false;
  }
  bytes_ += bytes.size();
  return true;
}

OptionalError SessionSpool::Replay(const std::function<void(const Value& record)>& visit) const {
  OptionalError error;
  std::unique_ptr<ReadableFile> file = files_.OpenForReading(path_, &error);
  if (!file) return error;
  std::string pending;
  std::string chunk;
  size_t offset = 0;
  for (;;) {
    if (OptionalError read = file->Read(kReadBytes, &chunk)) return read;
    if (chunk.empty()) return std::nullopt;  // a torn last record is left unread
    pending.erase(0, offset);
    offset = 0;
    pending += chunk;
    while (pending.size() - offset >= kLengthBytes) {
      const size_t length = PrefixLength(std::string_view(pending).substr(offset));
      if (pending.size() - offset - kLengthBytes < length) break;
      const auto begin = pending.begin() + std::ptrdiff_t(offset + kLengthBytes);
      Value record = Value::from_msgpack(begin, begin + std::ptrdiff_t(length), true, false);
      if (!record.is_array() || record.empty() || !record[0].is_string()) {
        return Error{kGeneralErrorDomain, -1,
                     fmt::format("spool {}: a record at byte {} does not decode", path_, offset)};
      }
      visit(record);
      offset += kLengthBytes + length;
    }
  }
}

void SessionSpool::Remove() {
  std::lock_guard lock(mutex_);
  if (removed_) return;
  removed_ = true;
  file_.reset();
  // A spool that was never opened has no file.
  if (!opened_ && !directory_.empty()) return;
  if (OptionalError error = files_.RemoveFile(path_)) {
    TLOG_ERROR(RuvoReportingSession::SessionLog(), "spool {}: {}", path_,
               error->LocalizedDescription());
  }
}

uint64_t SessionSpool::messageCount() const {
  std::lock_guard lock(mutex_);
  return messageCount_;
}

void SessionSpool::setMessageCount(uint64_t count) {
  std::lock_guard lock(mutex_);
  messageCount_ = count;
}

}  // namespace tavrin
