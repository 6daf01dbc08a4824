#include "sabled/FileContainer.h"

#include <simdjson.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <exception>
#include <limits>

#include "platform/Tally.h"
#include "platform/Transaction.h"
#include "sabled/ArchivedDataIterator.h"
#include "sabled/Assembly.h"
#include "sabled/ClientSession.h"
#include "sabled/FeedbackLedger.h"
#include "sabled/SableFeedback.h"
#include "sabled/SableLogging.h"

namespace sable {

namespace {

constexpr std::size_t kMaximumMappedBytes = std::numeric_limits<std::uint32_t>::max();
/// More is written at once.
constexpr std::size_t kMaximumBufferBytes = 64u << 10;
/// As much of a stranger's version string as is logged; ours is far shorter.
constexpr std::size_t kLoggedVersionBytes = 256;

const platform::LogHandle& log() {
  return SableLogForCategory(SableLoggingCategoryFeedbackStorage);
}

/// What follows the first dot of a name, when it is a UUID: the mark of a held file.
std::string tokenIn(const std::filesystem::path& fileUrl) {
  const std::string name = fileUrl.filename();
  const std::string suffix = name.substr(std::min(name.find('.'), name.size() - 1) + 1);
  return UUID::parse(suffix) ? suffix : "";
}

Expected<std::string_view> mmapFileHandle(platform::ReadableFile& fileHandle) {
  auto data = fileHandle.map(kMaximumMappedBytes);
  if (data) return data;
  if (data.error().code == EFBIG) {
    log().error("erroneous file data length");
  } else {
    log().error("mmap: {}", data.error().description());
  }
  return data;
}

std::uint64_t wholeRecords(std::string_view bytes) {
  ArchivedDataIterator records(bytes);
  std::uint64_t count = 0;
  while (records.skipNextObject()) ++count;
  return count;
}

/// Reads the records after the first two, up to one that cannot be used; says how many.
std::uint64_t decodeFeedbacks(ArchivedDataIterator& records, std::size_t dataLength, ClientSession& session) {
  SableFeedbackReader reader;
  std::uint64_t count = 0;
  while (records.hasMore()) {
    const auto record = records.readNextObject();
    if (!record) break;
    const auto feedback = reader.read(*record);
    if (!feedback) {
      log().error("{}", feedback.error().reason);
      log().error("could not unarchive feedback range {} size {}", records.position(), dataLength);
      break;
    }
    session.addSessionFeedbacks(*record, **feedback);
    ++count;
  }
  return count;
}

}  // namespace

FileContainer::FileContainer(Assembly& assembly, std::unique_ptr<platform::AppendableFile> fileHandle,
                             std::filesystem::path fileUrl, std::string version,
                             std::shared_ptr<platform::SerialQueue> queue, std::uint64_t maxFileSize)
    : assembly_(assembly),
      fileUrl_(std::move(fileUrl)),
      version_(std::move(version)),
      queue_(std::move(queue)),
      maxFileSize_(maxFileSize),
      location_(fileUrl_),
      token_(tokenIn(fileUrl_)),
      fileHandle_(std::move(fileHandle)) {}

FileContainer::FileContainer(Assembly& assembly, std::filesystem::path fileUrl, std::string version,
                             std::shared_ptr<platform::SerialQueue> queue, std::uint64_t maxFileSize)
    : FileContainer(assembly, nullptr, std::move(fileUrl), std::move(version), std::move(queue),
                    maxFileSize) {}

void FileContainer::writeSessionHeader(const ClientSession& session) {
  queue_->async([self = shared_from_this(), data = session.data()] {
    if (!self->fileHandle_) return;
    if (!self->_archiveData(self->version_) || !self->write()) {
      log().error("Could not write version string");
    } else if (!self->_archiveData(data) || !self->write()) {
      log().error("Could not write root object");
    }
  });
}

void FileContainer::writeFeedback(std::shared_ptr<const SableFeedback> feedback,
                                  platform::Function<void()> done) {
  // Without a third thing to hold, this work needs no memory of its own in the queue.
  if (!done) {
    return queue_->async(
        [self = shared_from_this(), feedback = std::move(feedback)] { self->addFeedback(*feedback, {}); });
  }
  queue_->async([self = shared_from_this(), feedback = std::move(feedback),
                 done = std::move(done)]() mutable { self->addFeedback(*feedback, std::move(done)); });
}

/// Writes behind what the queue has to do already, so that what is behind in that is written together.
void FileContainer::addFeedback(const SableFeedback& feedback, platform::Function<void()> done) {
  if (!fileHandle_) return ledger::count(assembly_.tally, endOfLaterRecords_);
  const bool isFirst = buffer_.empty();
  if (_archiveFeedback(feedback)) {
    ++bufferedFeedbacks_;
    if (done) written_.push_back(std::move(done));
    if (buffer_.size() >= kMaximumBufferBytes) write();
    if (isFirst) queue_->async([self = shared_from_this()] { self->write(); });
  } else {
    ledger::count(assembly_.tally, endOfLaterRecords_);
    if (done) done();
  }
}

bool FileContainer::_archiveData(std::string_view bytes) {
  const std::size_t start = beginRecord();
  buffer_.append(bytes);
  return endRecord(start);
}

bool FileContainer::_archiveFeedback(const SableFeedback& feedback) {
  const std::size_t start = beginRecord();
  feedback.appendData(buffer_);
  return endRecord(start);
}

/// Puts a record behind those that are to be written: its bytes follow in the buffer.
std::size_t FileContainer::beginRecord() {
  queue_->assertIsCurrent();
  buffer_.append(kArchivedLengthBytes, '\0');
  return buffer_.size() - kArchivedLengthBytes;
}

/// The record that begins at `start` is all there. One that the file has no room for closes it.
bool FileContainer::endRecord(std::size_t start) {
  if (!hasRoomFor(start)) {
    buffer_.resize(start);
    _closeFile();
    return false;
  }
  const std::uint64_t length = buffer_.size() - start - kArchivedLengthBytes;
  std::memcpy(&buffer_[start], &length, sizeof length);
  if (!transaction_) transaction_ = assembly_.platform.transactions().open("archiveObject");
  return true;
}

bool FileContainer::hasRoomFor(std::size_t start) {
  // A file that would just be full counts as too long.
  const std::uint64_t offset = fileSize_ + start, bytes = buffer_.size() - start;
  if (offset + bytes < maxFileSize_) return true;
  endOfLaterRecords_ = SBLLedgerEntry::sizeLimit;
  assembly_.tally.add("com.kestrel.sabled.filesizeexceeded", 1);
  log().error("bytes written ({}) + feedback ({}) exceeds max session size ({})", offset, bytes,
              maxFileSize_);
  return false;
}

/// Writes what there is. Closes the file when that fails: what came after half a record could not be
/// read.
bool FileContainer::write() {
  if (buffer_.empty()) return true;
  const auto appended = fileHandle_->append(buffer_, {});
  std::uint64_t feedbacks = bufferedFeedbacks_;
  if (!appended) {
    log().error("{}", appended.error().description());
    const std::uint64_t arrived = fileHandle_->size().value_or(fileSize_) - fileSize_;
    feedbacks = std::min(feedbacks, wholeRecords(std::string_view(buffer_).substr(0, arrived)));
    fileHandle_.reset();
  }
  ledger::count(assembly_.tally, SBLLedgerEntry::written, static_cast<std::int64_t>(feedbacks));
  ledger::count(assembly_.tally, endOfLaterRecords_,
                static_cast<std::int64_t>(bufferedFeedbacks_ - feedbacks));
  records_ += feedbacks;
  fileSize_ += buffer_.size();
  bufferedFeedbacks_ = 0;
  buffer_.clear();
  transaction_ = nullptr;
  for (auto& told : std::exchange(written_, {})) told();
  return appended.has_value();
}

void FileContainer::_close() {
  queue_->async([self = shared_from_this()] { self->_closeFile(); });
}

void FileContainer::_closeFile() {
  queue_->assertIsCurrent();
  write();
  log().debug("close file url {}", fileUrl_.native());
  fileHandle_.reset();
}

Expected<void> FileContainer::_hold(std::string_view prefix) {
  queue_->assertIsCurrent();
  if (!token_.empty()) return {};
  const std::string token = assembly_.runtime.uuid().string();
  auto held = location_;
  held.replace_filename(std::string(prefix) + token);
  if (auto renamed = assembly_.fileManager.replaceItem(held, location_); !renamed) return renamed;
  location_ = std::move(held);
  token_ = token;
  return {};
}

bool FileContainer::isNamed(std::string_view prefix) const {
  queue_->assertIsCurrent();
  return location_.filename().native().starts_with(prefix);
}

Expected<void> FileContainer::_delete() {
  queue_->assertIsCurrent();
  return assembly_.fileManager.remove(location_);
}

void FileContainer::_setHandedOver() {
  queue_->assertIsCurrent();
  readRecords_ = records_;
  end_ = SBLLedgerEntry::handedOver;
}

std::shared_ptr<ClientSession> FileContainer::read() {
  return queue_->sync([this] {
    auto ahead = std::exchange(ahead_, std::nullopt);
    return ahead ? *std::move(ahead) : readFile();
  });
}

void FileContainer::readAhead() {
  queue_->async([self = shared_from_this()] { self->ahead_ = self->readFile(); });
}

std::shared_ptr<ClientSession> FileContainer::readFile() {
  log().debug("reading file url {}", fileUrl_.native());
  end_ = SBLLedgerEntry::damaged;
  if (fileHandle_) {
    log().fault("file is already open closing it {}", fileUrl_.native());
    _closeFile();
  }
  const auto attributes = assembly_.fileManager.attributes(location_);
  if (!attributes) {
    log().error("Attribute fetch error {}", attributes.error().description());
    return nullptr;
  }
  if (attributes->size > maxFileSize_) {
    end_ = SBLLedgerEntry::tooLarge;
    assembly_.tally.add("com.kestrel.sabled.filetoolarge", 1);
    log().error("Session too big to process");
    return nullptr;
  }
  auto file = assembly_.fileManager.openForReading(location_);
  if (!file) {
    log().error("Could not open file for reading {}", fileUrl_.native());
    return nullptr;
  }
  return _unarchiveObject(*std::move(file));
}

std::shared_ptr<ClientSession> FileContainer::_unarchiveObject(
    std::unique_ptr<platform::ReadableFile> fileHandle) {
  queue_->assertIsCurrent();
  const auto data = mmapFileHandle(*fileHandle);
  if (!data) return nullptr;
  log().debug("unarchive {}", fileUrl_.native());
  if (data->empty()) {
    log().error("empty file");
    return nullptr;
  }
  try {
    auto session = decode(*data);
    if (session) session->setFile(std::move(fileHandle));
    return session;
  } catch (const std::exception& failure) {
    log().error("exception reading session archive {}", failure.what());
    return nullptr;
  }
}

std::shared_ptr<ClientSession> FileContainer::decode(std::string_view data) {
  ArchivedDataIterator records(data);
  const auto version = records.readNextObject();
  if (!version || !simdjson::validate_utf8(*version)) {
    log().error("version string not stored");
    return nullptr;
  }
  if (*version != version_) {
    end_ = SBLLedgerEntry::otherVersion;
    log().error("version not supported: {}", version->substr(0, kLoggedVersionBytes));
    return nullptr;
  }
  const auto root = records.readNextObject();
  auto session = root ? ClientSession::initWithData(assembly_, *root) : nullptr;
  if (!session) {
    log().error("client session not stored");
    return nullptr;
  }
  readRecords_ = decodeFeedbacks(records, data.size(), *session);
  end_ = SBLLedgerEntry::handedOver;
  return session;
}

std::uint64_t FileContainer::countRecords() {
  records_ = recordsInSessionFile(assembly_.fileManager, fileUrl_);
  return records_;
}

void FileContainer::closeAccount() {
  queue_->assertIsCurrent();
  const auto in = static_cast<std::int64_t>(records_);
  if (end_ != SBLLedgerEntry::handedOver) return ledger::countFile(assembly_.tally, end_, in);
  const auto read = static_cast<std::int64_t>(readRecords_);
  ledger::count(assembly_.tally, SBLLedgerEntry::handedOver, read);
  if (read < in) ledger::countFile(assembly_.tally, SBLLedgerEntry::damaged, in - read);
}

std::uint64_t recordsInSessionFile(platform::FileManager& fileManager, const std::filesystem::path& fileUrl) {
  const auto file = fileManager.openForReading(fileUrl);
  const auto data = file ? (*file)->map(kMaximumMappedBytes) : tl::unexpected(file.error());
  if (!data) return 0;
  constexpr std::uint64_t kVersionAndRoot = 2;
  const std::uint64_t records = wholeRecords(*data);
  return records - std::min(records, kVersionAndRoot);
}

}  // namespace sable
