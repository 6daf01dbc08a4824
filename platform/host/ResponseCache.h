#pragma once

#include <filesystem>
#include <list>
#include <memory>
#include <string>
#include <string_view>
#include <unordered_map>
#include <unordered_set>

#include "platform/Runtime.h"
#include "platform/host/CacheRules.h"

namespace sable::platform::host {

class CacheFile;

/// The responses a session keeps, one for each URL: the recently used ones in memory, all of them in
/// a file (CacheFile) that is read and written on a background queue. Lives on its owner's queue,
/// which never waits for the disk.
///
/// A set of the URLs in the file is kept in memory, so that an unknown URL costs one look. The file
/// is opened for the first response that is worth keeping; or, when there is one already, for the
/// first look.
class ResponseCache : public std::enable_shared_from_this<ResponseCache> {
 public:
  using Stored = std::shared_ptr<const StoredResponse>;
  using Found = Function<void(Stored)>;

  /// Capacities in bytes; none of one kind for 0. A response that would take more than a tenth of a
  /// capacity is not kept there.
  ResponseCache(Runtime& runtime, std::shared_ptr<SerialQueue> owner, std::filesystem::path file,
                std::size_t memoryCapacity, std::size_t diskCapacity);
  ~ResponseCache();
  ResponseCache(const ResponseCache&) = delete;
  ResponseCache& operator=(const ResponseCache&) = delete;

  /// Calls `found` with what is stored under a URL, or null: at once when the file need not be asked,
  /// otherwise later on the owner's queue.
  void find(const std::string& url, Found found);

  /// Keeps a response in the place of any other of that URL.
  void store(StoredResponse response);
  void remove(const std::string& url);

  /// Forgets what is in memory; the file keeps its own.
  void purgeMemory();
  /// Closes the file until it is needed again.
  void rest();

 private:
  using Entries = std::list<Stored>;

  Stored readFromFile(const std::string& url, Stored stored);
  void remember(Stored response);
  void forget(const std::string& url);
  bool mayBeInFile(const std::string& url);
  void openFile();

  Runtime& runtime_;
  const std::shared_ptr<SerialQueue> owner_;
  const std::filesystem::path path_;
  const std::size_t memoryCapacity_;
  const std::size_t diskCapacity_;

  Entries entries_;  // most recently used first
  std::unordered_map<std::string_view, Entries::iterator> byURL_;
  std::size_t memoryUsed_ = 0;

  enum class FileState {
    unknown,   ///< nobody has looked
    none,      ///< there was none at the first look
    opening,   ///< what it holds is not known yet
    open,      ///< urlsInFile_ is complete
    unusable,  ///< no disk for this process
  };
  FileState fileState_ = FileState::unknown;
  std::unordered_set<std::size_t> urlsInFile_;  // hashes
  std::shared_ptr<SerialQueue> diskQueue_;
  std::shared_ptr<CacheFile> file_;  // used on diskQueue_ only
};

}  // namespace sable::platform::host
