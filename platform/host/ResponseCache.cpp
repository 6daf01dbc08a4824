#include "platform/host/ResponseCache.h"

#include <system_error>

#include "platform/host/CacheFile.h"

namespace sable::platform::host {
namespace {

// A response that takes a larger part of a capacity would drive out too many others.
constexpr std::size_t kLargestPart = 10;

std::size_t hashOf(const std::string& url) {
  return std::hash<std::string>()(url);
}

}  // namespace

ResponseCache::ResponseCache(Runtime& runtime, std::shared_ptr<SerialQueue> owner, std::filesystem::path file,
                             std::size_t memoryCapacity, std::size_t diskCapacity)
    : runtime_(runtime),
      owner_(std::move(owner)),
      path_(std::move(file)),
      memoryCapacity_(memoryCapacity),
      diskCapacity_(diskCapacity),
      fileState_(diskCapacity == 0 ? FileState::unusable : FileState::unknown) {}

ResponseCache::~ResponseCache() {
  // The last writes still have to be done; the file closes after them.
  if (diskQueue_) diskQueue_->async([file = std::move(file_)] {});
}

void ResponseCache::find(const std::string& url, Found found) {
  if (const auto entry = byURL_.find(url); entry != byURL_.end()) {
    entries_.splice(entries_.begin(), entries_, entry->second);
    return found(entries_.front());
  }
  if (!mayBeInFile(url)) return found(nullptr);
  diskQueue_->async(
      [weak = weak_from_this(), owner = owner_, file = file_, url, found = std::move(found)]() mutable {
        auto read = file->read(url);
        auto stored = read ? std::make_shared<const StoredResponse>(std::move(*read)) : nullptr;
        owner->async([weak, url, stored = std::move(stored), found = std::move(found)]() mutable {
          const auto self = weak.lock();
          found(self ? self->readFromFile(url, std::move(stored)) : std::move(stored));
        });
      });
}

ResponseCache::Stored ResponseCache::readFromFile(const std::string& url, Stored stored) {
  // Meanwhile it may have been replaced or removed.
  if (const auto entry = byURL_.find(url); entry != byURL_.end()) return *entry->second;
  if (!mayBeInFile(url)) return nullptr;
  if (stored) {
    remember(stored);
  } else {
    urlsInFile_.erase(hashOf(url));
  }
  return stored;
}

bool ResponseCache::mayBeInFile(const std::string& url) {
  if (fileState_ == FileState::unknown) {
    std::error_code error;
    if (std::filesystem::exists(path_, error)) {
      openFile();
    } else {
      fileState_ = FileState::none;
    }
  }
  return fileState_ == FileState::opening ||
         (fileState_ == FileState::open && urlsInFile_.contains(hashOf(url)));
}

void ResponseCache::openFile() {
  fileState_ = FileState::opening;
  diskQueue_ = runtime_.serialQueue(owner_->label() + ".cache", QualityOfService::background);
  file_ = std::make_shared<CacheFile>(path_, diskCapacity_);
  diskQueue_->async([weak = weak_from_this(), owner = owner_, file = file_] {
    const bool usable = file->isUsable();
    owner->async([weak, usable, urls = file->urls()] {
      const auto self = weak.lock();
      if (!self) return;
      self->fileState_ = usable ? FileState::open : FileState::unusable;
      for (const auto& url : urls) self->urlsInFile_.insert(hashOf(url));
    });
  });
}

void ResponseCache::store(StoredResponse response) {
  const auto stored = std::make_shared<const StoredResponse>(std::move(response));
  if (CacheFile::sizeOf(*stored) > diskCapacity_ / kLargestPart) remove(stored->url);
  remember(stored);
  if (fileState_ == FileState::unusable || CacheFile::sizeOf(*stored) > diskCapacity_ / kLargestPart) {
    return;
  }
  if (!file_) openFile();
  urlsInFile_.insert(hashOf(stored->url));
  diskQueue_->async([weak = weak_from_this(), owner = owner_, file = file_, stored] {
    auto dropped = file->write(*stored);
    if (!file->isUsable()) {
      owner->async([weak] {
        if (const auto self = weak.lock()) self->fileState_ = FileState::unusable;
      });
    } else if (!dropped.empty()) {
      owner->async([weak, dropped = std::move(dropped)] {
        const auto self = weak.lock();
        for (const auto& url : dropped) {
          if (self) self->urlsInFile_.erase(hashOf(url));
        }
      });
    }
  });
}

void ResponseCache::remember(Stored response) {
  forget(response->url);
  const std::size_t size = CacheFile::sizeOf(*response);
  if (size > memoryCapacity_ / kLargestPart) return;
  entries_.push_front(std::move(response));
  byURL_.emplace(entries_.front()->url, entries_.begin());
  memoryUsed_ += size;
  while (memoryUsed_ > memoryCapacity_) forget(std::string(entries_.back()->url));
}

void ResponseCache::forget(const std::string& url) {
  const auto entry = byURL_.find(url);
  if (entry == byURL_.end()) return;
  const auto place = entry->second;
  byURL_.erase(entry);
  memoryUsed_ -= CacheFile::sizeOf(**place);
  entries_.erase(place);
}

void ResponseCache::remove(const std::string& url) {
  forget(url);
  if (!mayBeInFile(url)) return;
  urlsInFile_.erase(hashOf(url));
  diskQueue_->async([file = file_, url] { file->remove(url); });
}

void ResponseCache::purgeMemory() {
  byURL_.clear();
  entries_.clear();
  memoryUsed_ = 0;
}

void ResponseCache::rest() {
  if (file_) diskQueue_->async([file = file_] { file->close(); });
}

}  // namespace sable::platform::host
