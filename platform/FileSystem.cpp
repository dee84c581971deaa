#include "platform/FileSystem.h"

namespace tavrin {

OptionalError FileSystem::WriteFileAtomically(const std::string& path, std::string_view contents) {
  OptionalError error;
  std::unique_ptr<WritableFile> file = BeginAtomicWrite(path, &error);
  if (!file) return error;
  if (OptionalError appended = file->Append(contents)) return appended;
  return file->Commit();
}

}  // namespace tavrin
