#pragma once

#include <array>
#include <atomic>
#include <cstddef>
#include <filesystem>
#include <memory>
#include <mutex>
#include <optional>

#include "platform/Error.h"
#include "platform/Tally.h"
#include "platform/host/Descriptor.h"

namespace sable::platform::host {

/// Counters in a memory-mapped file: adding is one atomic addition in memory that the kernel keeps
/// when the process dies, so nothing is ever flushed. A power cut may lose the last seconds.
///
/// The file, in the byte order of the machine; it grows by doubling:
///
///     offset      bytes  content
///     0           8      "SBLTALLY"
///     8           4      version, 1
///     12          4      bytes per slot, 128
///     16          112    zero
///     128 * n     8      value of slot n (n from 1), signed
///       + 8       1      length of the key, 1 to 119; 0: the slot is free
///       + 9       119    key, UTF-8
///
/// A key is written before its length, and slots are taken in order and never given back. One
/// process at a time holds the file, by a lock on it; readers need none. A file that is something
/// else is reported and renamed to NAME.damaged. Where the file cannot be had, the counters live
/// in memory and that is logged once.
class MappedTally final : public Tally {
 public:
  static constexpr std::size_t kMaximumKeyBytes = 119;
  static constexpr std::size_t kMaximumKeys = 4095;

  explicit MappedTally(const std::filesystem::path& path);
  ~MappedTally() override;
  MappedTally(const MappedTally&) = delete;
  MappedTally& operator=(const MappedTally&) = delete;

  /// A key that is empty or too long, and one beyond the maximum, is not counted; logged once.
  void add(std::string_view key, std::int64_t value) override;
  void set(std::string_view key, std::int64_t value) override;
  std::map<std::string, std::int64_t> snapshot() const override;

  bool isPersistent() const { return static_cast<bool>(file_); }

  /// The counters in a file, also while a daemon writes it.
  static Expected<std::map<std::string, std::int64_t>> snapshotOf(const std::filesystem::path& path);

 private:
  struct Slot;
  struct Header;

  Slot* slot(std::size_t number) const;
  std::size_t find(std::string_view key) const;
  Slot* findOrInsert(std::string_view key);
  std::size_t insert(std::string_view key);
  void index(std::size_t number);

  Expected<void> openFile(const std::filesystem::path& path);
  Expected<void> grow(std::size_t slots);
  void mapMemory();
  void indexSlots();
  void reportOnce(std::string_view what);

  Descriptor file_;
  std::byte* mapping_ = nullptr;  ///< as long as the largest file; what lies past its end is not touched

  /// Hash table of slot numbers, linear probing, twice as many places as keys; 0 is a free place.
  static constexpr std::size_t kPlaces = 8192;
  std::unique_ptr<std::array<std::atomic<std::uint16_t>, kPlaces>> places_;
  std::atomic<std::size_t> used_ = 1;  ///< slots in use, the header counted
  std::atomic<bool> reported_ = false;

  std::mutex insertion_;
  std::size_t capacity_ = 0;  ///< slots in the file, the header counted
};

}  // namespace sable::platform::host
