#include "sabled/FileOutputStream.h"

namespace sable {

namespace {

constexpr std::size_t kBufferBytes = 64u << 10;

}  // namespace

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
  buffer_ += bytes;
  if (buffer_.size() >= kBufferBytes && !writeBuffer()) return -1;
  return static_cast<std::ptrdiff_t>(bytes.size());
}

bool FileOutputStream::writeBuffer() {
  auto appended = file_->append(buffer_, {});
  if (!appended) error_ = std::move(appended.error());
  buffer_.clear();
  return !error_;
}

void FileOutputStream::close() {
  if (file_ && !error_ && !buffer_.empty()) writeBuffer();
  file_.reset();
}

StreamStatus FileOutputStream::streamStatus() const {
  if (error_) return StreamStatus::error;
  return file_ ? StreamStatus::open : StreamStatus::notOpen;
}

}  // namespace sable
