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
  const auto fileUrl = _newFileUrl();
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

std::optional<std::filesystem::path> SablePersistentStorage::_newFileUrl() {
  if (!cachesUrl_) return std::nullopt;
  (void)assembly_.fileManager.createDirectory(*cachesUrl_);  // where that fails, making the file does too
  for (;;) {
    auto fileUrl = *cachesUrl_ / fmt::format("{}{}", kFilePrefix, handleId_++);
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

std::vector<std::shared_ptr<FileContainer>> SablePersistentStorage::getAvailableSessionHandles() {
  return queue_->sync([this] {
    for (const auto& container : fileContainers_)
      log().debug("available file url {}", container->fileUrl().native());
    return fileContainers_;
  });
}

void SablePersistentStorage::deleteSessionWithFileContainer(const std::shared_ptr<FileContainer>& container) {
  queue_->sync([&] {
    std::erase(fileContainers_, container);
    _deleteSessionFile(*container);
    container->closeAccount();
  });
}

void SablePersistentStorage::_deleteSessionFile(const FileContainer& container) {
  log().debug("delete file url {}", container.fileUrl().native());
  if (const auto removed = assembly_.fileManager.remove(container.fileUrl()); !removed) {
    log().error("File {} delete failed", container.fileUrl().native());
  }
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
  fileContainers_.push_back(
      std::make_shared<FileContainer>(assembly_, fileUrl, version_, queue_, maxFileSize_));
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
  queue_->async([&tally = assembly_.tally, found = fileContainers_,
                 before = SBLFeedbackLedger(assembly_.tally.snapshot())] {
    std::uint64_t stored = 0;
    for (const auto& container : found) stored += container->countRecords();
    ledger::settleStored(tally, before, static_cast<std::int64_t>(stored));
  });
}

}  // namespace sable
