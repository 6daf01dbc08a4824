#include "sabled/SablePersistentStorage.h"

#include <fmt/core.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <utility>

#include "SableKit/SBLConstants.h"
#include "platform/FileManager.h"
#include "platform/Tally.h"
#include "platform/UserDefaults.h"
#include "sabled/Assembly.h"
#include "sabled/FeedbackLedger.h"
#include "sabled/FileContainer.h"
#include "sabled/SableLogging.h"
#include "sabled/UserAgent.h"

namespace sable {

namespace {

constexpr std::string_view kFilePrefix = "session.";
constexpr std::string_view kHeldPrefix = "flushing.";
constexpr std::string_view kCrowdsourcingPrefix = "crowdsourcing.";
constexpr std::int64_t kDefaultMaxFileSize = 2097152;  // bytes
constexpr double kDefaultMaxFileAge = 172800;          // seconds

const platform::LogHandle& log() {
  return SableLogForCategory(SableLoggingCategoryFeedbackStorage);
}

std::optional<std::filesystem::path> sessionDirectory(platform::FileManager& fileManager) {
  const auto caches = fileManager.cachesDirectory();
  if (!caches) return std::nullopt;
  return *caches / kSBLSubsystem;
}

/// Whether it may have passed when the same is tried later.
bool isTroubleOfDisk(const Error& error) {
  constexpr std::int64_t kPassing[] = {ENOSPC, EDQUOT, EIO, EROFS, EMFILE, ENFILE, ENOMEM, EACCES, EPERM};
  return std::ranges::find(kPassing, error.code) != std::end(kPassing);
}

}  // namespace

SablePersistentStorage::SablePersistentStorage(Assembly& assembly)
    : assembly_(assembly),
      queue_(assembly.runtime.serialQueue("com.kestrel.sabled.persistentStorageQueue",
                                          platform::QualityOfService::background)),
      cachesUrl_(sessionDirectory(assembly.fileManager)),
      version_(sabledUserAgent(assembly.platform.deviceInfo())),
      maxFileSize_(static_cast<std::uint64_t>(std::max<std::int64_t>(
          0, assembly.userDefaults.integer(kSBLSessionSizeLimit).value_or(kDefaultMaxFileSize)))),
      maxFileAge_(platform::fromSeconds(
          assembly.userDefaults.number(kSBLSessionMaxAge).value_or(kDefaultMaxFileAge))) {
  _scanCacheDirectory();
  settleLedger();
}

std::shared_ptr<FileContainer> SablePersistentStorage::createFileContainerForWriting() {
  return containerIn(_newFileUrl([this] { return fmt::format("{}{}", kFilePrefix, handleId_++); }));
}

std::shared_ptr<FileContainer> SablePersistentStorage::createCrowdsourcingFileContainerForWriting() {
  return containerIn(
      _newFileUrl([this] { return std::string(kCrowdsourcingPrefix) + assembly_.runtime.uuid().string(); }));
}

std::shared_ptr<FileContainer> SablePersistentStorage::containerIn(
    const std::optional<std::filesystem::path>& fileUrl) {
  if (!fileUrl) {
    log().error("Could not get a file url");
    return nullptr;
  }
  log().debug("new file url {}", fileUrl->native());
  auto fileHandle = assembly_.fileManager.openForAppending(*fileUrl);
  if (!fileHandle) {
    log().error("Could not open file for writing {}", fileUrl->native());
    return nullptr;
  }
  return std::make_shared<FileContainer>(assembly_, *std::move(fileHandle), *fileUrl, version_, queue_,
                                         maxFileSize_);
}

std::optional<std::filesystem::path> SablePersistentStorage::_newFileUrl(
    const std::function<std::string()>& nextName) {
  if (!cachesUrl_) return std::nullopt;
  (void)assembly_.fileManager.createDirectory(*cachesUrl_);  // where that fails, making the file does too
  for (;;) {
    auto fileUrl = *cachesUrl_ / nextName();
    const auto created = assembly_.fileManager.createFile(fileUrl);
    if (created) return fileUrl;
    if (created.error().code == EEXIST) continue;
    log().error("{}", created.error().description());
    return std::nullopt;
  }
}

void SablePersistentStorage::closeSessionWithFileContainer(std::shared_ptr<FileContainer> container) {
  queue_->async([this, container = std::move(container)] {
    container->_closeFile();
    fileContainers_.push_back(container);
  });
}

void SablePersistentStorage::closeCrowdsourcingSessionWithFileContainer(
    std::shared_ptr<FileContainer> container) {
  queue_->async([this, container = std::move(container)] {
    container->_closeFile();
    crowdsourcingContainers_.push_back(container);
  });
}

std::vector<std::shared_ptr<FileContainer>> SablePersistentStorage::getAvailableSessionHandles() {
  return queue_->sync([this] { return available(fileContainers_); });
}

std::vector<std::shared_ptr<FileContainer>> SablePersistentStorage::getAvailableCrowdsourcingHandles() {
  return queue_->sync([this] { return available(crowdsourcingContainers_); });
}

SablePersistentStorage::FileContainers SablePersistentStorage::available(const FileContainers& list) {
  for (const auto& container : list) log().debug("available file url {}", container->fileUrl().native());
  return list;
}

/// The list in which the file waits.
SablePersistentStorage::FileContainers& SablePersistentStorage::listOf(const FileContainer& container) {
  return container.isNamed(kCrowdsourcingPrefix) ? crowdsourcingContainers_ : fileContainers_;
}

bool SablePersistentStorage::holdSessionWithFileContainer(const std::shared_ptr<FileContainer>& container) {
  return queue_->sync([&] {
    const auto held = container->_hold(kHeldPrefix);
    if (!held) log().error("{}", held.error().description());
    if (!held && isTroubleOfDisk(held.error())) return false;
    std::erase(listOf(*container), container);
    return true;
  });
}

void SablePersistentStorage::releaseSessionWithFileContainer(
    const std::shared_ptr<FileContainer>& container) {
  queue_->sync([&] { listOf(*container).push_back(container); });
}

void SablePersistentStorage::deleteSessionWithFileContainer(const std::shared_ptr<FileContainer>& container) {
  queue_->sync([&] {
    std::erase(listOf(*container), container);
    _deleteSessionFile(*container);
    container->closeAccount();
  });
}

void SablePersistentStorage::_deleteSessionFile(FileContainer& container) {
  log().debug("delete file url {}", container.fileUrl().native());
  if (!container._delete()) log().error("File {} delete failed", container.fileUrl().native());
}

void SablePersistentStorage::adoptHeldSessions(const std::function<bool(const std::string&)>& hasAccepted) {
  queue_->sync([&] {
    for (const auto& container : std::exchange(heldByEarlierRuns_, {})) {
      if (hasAccepted(container->token())) {
        _deleteSessionFile(*container);
        container->_setHandedOver();
        container->closeAccount();
      } else if (const auto attributes = assembly_.fileManager.attributes(container->fileUrl());
                 !attributes) {
        log().error("Attribute fetch error {}", attributes.error().description());
      } else if (!deleteIfTooOld(container->fileUrl(), attributes->creationDate)) {
        listOf(*container).push_back(container);
      }
    }
  });
}

void SablePersistentStorage::_scanCacheDirectory() {
  if (!cachesUrl_) {
    log().error("error scanning cache directory, could not get path");
    return;
  }
  const auto names = assembly_.fileManager.list(*cachesUrl_);
  if (!names) {
    // The first start finds no directory; the first file makes it.
    if (names.error().code != ENOENT)
      log().error("error scanning cache directory {}", names.error().description());
    return;
  }
  for (const std::string& name : *names) {
    if (name.starts_with(kFilePrefix)) scanFile(name);
    if (name.starts_with(kHeldPrefix) || name.starts_with(kCrowdsourcingPrefix)) scanHeldFile(name);
  }
}

void SablePersistentStorage::scanFile(const std::string& name) {
  const std::filesystem::path fileUrl = *cachesUrl_ / name;
  const auto attributes = assembly_.fileManager.attributes(fileUrl);
  if (!attributes) {
    log().error("Attribute fetch error {}", attributes.error().description());
    return;
  }
  if (deleteIfTooOld(fileUrl, attributes->creationDate)) return;
  // A name without a number of ours is one that we never give, so that it need not be passed over.
  std::uint32_t number = 0;
  const char* end = name.data() + name.size();
  if (std::from_chars(name.data() + kFilePrefix.size(), end, number).ptr == end)
    handleId_ = std::max(handleId_.load(), number + 1);
  fileContainers_.push_back(foundFile(fileUrl));
}

/// Its age is looked at when it is adopted: it may have been sent long ago.
void SablePersistentStorage::scanHeldFile(const std::string& name) {
  auto container = foundFile(*cachesUrl_ / name);
  if (!container->token().empty()) heldByEarlierRuns_.push_back(std::move(container));
}

std::shared_ptr<FileContainer> SablePersistentStorage::foundFile(const std::filesystem::path& fileUrl) {
  return std::make_shared<FileContainer>(assembly_, fileUrl, version_, queue_, maxFileSize_);
}

bool SablePersistentStorage::deleteIfTooOld(const std::filesystem::path& fileUrl,
                                            platform::WallTime creationDate) {
  if (assembly_.runtime.now() - creationDate <= maxFileAge_) return false;
  assembly_.tally.add("com.kestrel.sabled.filetooold", 1);
  const auto records = static_cast<std::int64_t>(recordsInSessionFile(assembly_.fileManager, fileUrl));
  if (const auto removed = assembly_.fileManager.remove(fileUrl); !removed)
    log().error("file removing error {}", removed.error().description());
  ledger::countFile(assembly_.tally, SBLLedgerEntry::tooOld, records);
  return true;
}

/// What is on the disk says what became of the records that the last run had not yet counted. Later,
/// but before a first write: nobody who starts up waits for the files to be read.
void SablePersistentStorage::settleLedger() {
  FileContainers found = fileContainers_;
  found.insert(found.end(), heldByEarlierRuns_.begin(), heldByEarlierRuns_.end());
  queue_->async([&tally = assembly_.tally, found = std::move(found),
                 before = SBLFeedbackLedger(assembly_.tally.snapshot())] {
    std::uint64_t stored = 0;
    for (const auto& container : found) stored += container->countRecords();
    ledger::settleStored(tally, before, static_cast<std::int64_t>(stored));
  });
}

}  // namespace sable
