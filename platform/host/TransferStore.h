#pragma once

#include <filesystem>
#include <functional>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "platform/host/Descriptor.h"
#include "platform/host/TransferDatabase.h"

namespace sable::platform::host {

/// Where background transfers are kept, in the state folder (files 0600, folders 0700):
///
///     transfers.db            what there is to know of each (TransferDatabase)
///     transfers/N.upload      the body of upload N until its end has been reported
///     transfers/N.download    empty, for as long as download N is under way
///     transfers/N.part        what has come of it
///     uploads/N.deflate       the bodies of the last kRememberedUploads uploads, for the device's owner
///
/// A row is committed when its file is on the disk, and the file goes when the row says "reported", so
/// an empty folder `transfers` means that nothing is under way: then the database is not opened. A file
/// without a row is what a kill has left of a call that has not returned: it is removed at the first
/// opening. A damaged database is moved aside as transfers.db.damaged and made anew; what was under way
/// is lost with it.
///
/// One process at a time: the folder `transfers` is locked (flock(2)) from the first opening on. Blocks
/// on the disk. Any thread; sessions share it.
class TransferStore {
 public:
  /// `keepsUploads` says whether the folder `uploads` is to hold anything; asked at each end of one.
  TransferStore(std::filesystem::path stateFolder, std::function<bool()> keepsUploads);

  std::vector<BackgroundTransfer> unreported(const std::string& session);
  /// Errors of kPOSIXErrorDomain, or SQLite's.
  Expected<std::int64_t> accept(const std::string& session, const BackgroundTransfer& transfer,
                                std::string_view token, const std::filesystem::path& body);
  void note(const BackgroundTransfer& transfer);
  /// Also drops what the session has reported and accepted before that time.
  void noteReported(const std::string& session, const BackgroundTransfer& transfer, WallTime forgetBefore);
  bool hasAccepted(const std::string& session, std::string_view token, WallTime since);
  /// Closes the database until it is needed again.
  void rest();

  /// The body of an upload, for reading.
  Expected<Descriptor> openBody(std::int64_t identifier);
  /// What comes of a download, empty, for writing.
  Expected<Descriptor> openPart(std::int64_t identifier);
  std::filesystem::path part(std::int64_t identifier) const;

  static std::filesystem::path databaseIn(const std::filesystem::path& stateFolder);
  /// The body of an upload, under way or remembered; empty where neither is there.
  static std::filesystem::path bodyIn(const std::filesystem::path& stateFolder, std::int64_t identifier);

 private:
  Expected<void> open();
  Expected<void> openFolder();
  int openDatabase();
  void recover();
  void tidy(std::int64_t identifier);
  void keepLast(std::size_t count);
  Expected<void> store(std::int64_t identifier, HTTPBackgroundTaskKind kind, int body);
  /// Runs it on the open database; where that turns out to be damaged, once more on a new one.
  Expected<void> run(const std::function<int()>& operation);
  void discard();

  const std::filesystem::path folder_;
  const std::filesystem::path spool_;
  const std::filesystem::path uploads_;
  const std::function<bool()> keepsUploads_;

  std::mutex mutex_;
  Descriptor lock_;  // the folder `transfers`
  TransferDatabase database_;
  bool recovered_ = false;
};

}  // namespace sable::platform::host
