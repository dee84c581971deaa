#include "platform/linux/settings/TomlDeviceInfo.h"

#include <limits>

#include "platform/LogSystem.h"
#include "platform/linux/settings/TomlDefaultsDomain.h"

namespace tavrin {

TomlDeviceInfo::TomlDeviceInfo(std::string path) : path_(std::move(path)) {}

const Value* TomlDeviceInfo::FindLocked(std::string_view key) {
  if (!facts_) {
    TomlFileLoad load = LoadTomlFile(path_);
    if (load.status == TomlFileLoad::Status::kFailed) {
      TLOG_ERROR(nullptr, "device facts unreadable, using fallbacks: {}", load.error);
    }
    facts_ = std::move(load.values);
  }
  const auto found = facts_->find(key);
  return found == facts_->end() ? nullptr : &*found;
}

bool TomlDeviceInfo::FirstComplaintLocked(std::string_view key, std::string_view wanted) {
  return reportedProblems_.insert(std::string(key) + "\n" + std::string(wanted)).second;
}

bool TomlDeviceInfo::QueryBool(std::string_view key, bool fallback) {
  std::lock_guard lock(mutex_);
  const Value* value = FindLocked(key);
  if (!value) return fallback;
  if (value->is_boolean()) return value->get<bool>();
  if (FirstComplaintLocked(key, "bool")) {
    TLOG_ERROR(nullptr, "device fact {} in {} is {}, not a boolean; using {}", key, path_,
               JsonText(*value), fallback);
  }
  return fallback;
}

int32_t TomlDeviceInfo::QueryInt32(std::string_view key, int32_t fallback) {
  std::lock_guard lock(mutex_);
  const Value* value = FindLocked(key);
  if (!value) return fallback;
  if (value->is_number_integer()) {
    const int64_t number = value->get<int64_t>();
    if (value->is_number_unsigned() ? value->get<uint64_t>() <= uint64_t(INT32_MAX)
                                    : number >= INT32_MIN && number <= INT32_MAX) {
      return int32_t(number);
    }
  }
  if (FirstComplaintLocked(key, "int32")) {
    TLOG_ERROR(nullptr, "device fact {} in {} is {}, not a 32-bit integer; using {}", key, path_,
               JsonText(*value), fallback);
  }
  return fallback;
}

}  // namespace tavrin
