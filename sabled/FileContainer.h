#pragma once

#include <cstdint>
#include <filesystem>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "SableKit/SBLFeedbackLedger.h"
#include "platform/FileManager.h"
#include "platform/Function.h"
#include "platform/Runtime.h"
#include "platform/Transaction.h"

namespace sable {

class Assembly;
class ClientSession;
class SableFeedback;

/// One session file: records behind each other, with nothing between or after them.
///
///     bytes  content
///     8      length of the payload, unsigned, in the byte order of the machine
///     n      payload
///
///     record  payload
///     1       the user agent of the daemon that wrote the file, UTF-8
///     2       the session: a `_SKClientSession` without feedback
///     3 ...   a feedback each, as they came: a `_SKSableFeedback`
///
/// Another build of the daemon or of the system has another user agent and does not read the file.
/// A record is written as soon as the queue comes to it, in one go with those that have come meanwhile,
/// and reaches the disk in the system's own time: a kill tears at most the last one, and what stands
/// before it is read.
///
///     open --close, a write that failed, a record past the limit--> closed
///     closed --_hold--> under a name of its own, which no other file ever has, until it is deleted
///
/// Writes to a closed file are left out without a word. All work on the file is done on the
/// storage's queue; callers that write never wait for it.
class FileContainer : public std::enable_shared_from_this<FileContainer> {
 public:
  /// A file of at most `maxFileSize` bytes, just made and open, for a session to write.
  FileContainer(Assembly& assembly, std::unique_ptr<platform::AppendableFile> fileHandle,
                std::filesystem::path fileUrl, std::string version,
                std::shared_ptr<platform::SerialQueue> queue, std::uint64_t maxFileSize);
  /// A file found on the disk; it is held when its name says so.
  FileContainer(Assembly& assembly, std::filesystem::path fileUrl, std::string version,
                std::shared_ptr<platform::SerialQueue> queue, std::uint64_t maxFileSize);

  const std::filesystem::path& fileUrl() const { return fileUrl_; }
  /// The UUID in the name of a held file, which stands for what the file holds; else empty.
  const std::string& token() const { return token_; }

  /// Writes the first two records, later, from the session as it is now.
  void writeSessionHeader(const ClientSession& session);
  /// Writes a record, later, of the feedback, which does not change any more, and then calls `done` on the
  /// storage's queue. Where the file is closed `done` is destroyed uncalled.
  void writeFeedback(std::shared_ptr<const SableFeedback> feedback, platform::Function<void()> done = {});

  /// The session with its feedback; null when the file is none that this daemon can use, which is
  /// logged. The session keeps the file open, and readable though it be deleted. Waits for the disk.
  std::shared_ptr<ClientSession> read();
  /// Lets the storage begin with what the next read() returns.
  void readAhead();

  // For the storage, on its queue.
  /// Renames the file to `prefix` and a UUID, so that the next process, too, knows it for the one that was
  /// being sent; a file that is held stays as it is.
  Expected<void> _hold(std::string_view prefix);
  bool isNamed(std::string_view prefix) const;
  Expected<void> _delete();
  /// An earlier process has handed the records over.
  void _setHandedOver();
  /// Counts the records of a file that was found, whether or not this daemon can read them; a torn
  /// one does not count. Logs nothing.
  std::uint64_t countRecords();
  /// Tells the ledger what became of the records, now that the file has been deleted.
  void closeAccount();

  void _close();
  void _closeFile();  ///< on the storage's queue

 private:
  bool _archiveData(std::string_view bytes);
  bool _archiveFeedback(const SableFeedback& feedback);
  std::size_t beginRecord();
  bool endRecord(std::size_t start);
  bool hasRoomFor(std::size_t start);
  void addFeedback(const SableFeedback& feedback, platform::Function<void()> done);
  bool write();
  std::shared_ptr<ClientSession> readFile();
  std::shared_ptr<ClientSession> _unarchiveObject(std::unique_ptr<platform::ReadableFile> fileHandle);
  std::shared_ptr<ClientSession> decode(std::string_view data);

  Assembly& assembly_;
  const std::filesystem::path fileUrl_;  ///< by which it is known, here and in the log
  const std::string version_;
  const std::shared_ptr<platform::SerialQueue> queue_;
  const std::uint64_t maxFileSize_;

  // On queue_.
  std::filesystem::path location_;                        ///< where the bytes are
  std::string token_;                                     ///< not changed any more once it is set
  std::unique_ptr<platform::AppendableFile> fileHandle_;  ///< null when closed
  std::uint64_t fileSize_ = 0;                            ///< of a file that is written here
  /// Records to be written, of which so many are feedback, and who is told then.
  std::string buffer_;
  std::uint64_t bufferedFeedbacks_ = 0;
  std::vector<platform::Function<void()>> written_;
  std::shared_ptr<platform::Transaction> transaction_;  ///< as long as there are any
  std::uint64_t records_ = 0, readRecords_ = 0;         ///< feedback in the file; as far as it was read
  SBLLedgerEntry endOfLaterRecords_ = SBLLedgerEntry::unwritten;  ///< of those that find the file closed
  SBLLedgerEntry end_ = SBLLedgerEntry::damaged;         ///< of those in the file, by the last read()
  std::optional<std::shared_ptr<ClientSession>> ahead_;  ///< read before anybody asked for it, or null
};

/// The feedback records in a session file, as FileContainer::countRecords().
std::uint64_t recordsInSessionFile(platform::FileManager& fileManager, const std::filesystem::path& fileUrl);

}  // namespace sable
