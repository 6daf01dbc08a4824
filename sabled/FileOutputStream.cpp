#include "sabled/FileOutputStream.h"

namespace sable {

void FileOutputStream::open() {
  auto file = fileManager_.openForAppending(path_);
  if (file) {
    file_ = *std::move(file);
  } else {
    error_ = std::move(file.error());
  }
}

std::ptrdiff_t FileOutputStream::write(std::string_view bytes) {
  if (!file_ || error_) return -1;
  if (auto appended = file_->append(bytes, {}); !appended) {
    error_ = std::move(appended.error());
    return -1;
  }
  return static_cast<std::ptrdiff_t>(bytes.size());
}

StreamStatus FileOutputStream::streamStatus() const {
  if (error_) return StreamStatus::error;
  return file_ ? StreamStatus::open : StreamStatus::notOpen;
}

}  // namespace sable
