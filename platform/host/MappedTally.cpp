#include "platform/host/MappedTally.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/mman.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <functional>

#include "platform/Log.h"
#include "platform/host/TrustedPath.h"

namespace sable::platform::host {

namespace {

using Path = std::filesystem::path;

constexpr char kMagic[8] = {'S', 'B', 'L', 'T', 'A', 'L', 'L', 'Y'};
constexpr std::uint32_t kVersion = 1;
constexpr std::size_t kSlotBytes = 128;
constexpr std::size_t kMaximumSlots = MappedTally::kMaximumKeys + 1;
constexpr std::size_t kMaximumBytes = kMaximumSlots * kSlotBytes;
constexpr std::size_t kFirstCapacity = 32;

}  // namespace

struct MappedTally::Header {
  char magic[8];
  std::uint32_t version;
  std::uint32_t slotBytes;
};

struct MappedTally::Slot {
  std::int64_t value;
  std::uint8_t length;
  char key[kMaximumKeyBytes];

  std::string_view name() const { return {key, length}; }
};

namespace {

template <class Header>
bool isOurs(std::string_view bytes) {
  if (bytes.size() < kSlotBytes || bytes.size() % kSlotBytes != 0 || bytes.size() > kMaximumBytes)
    return false;
  Header header{};
  std::memcpy(&header, bytes.data(), sizeof header);
  if (std::memcmp(header.magic, kMagic, sizeof kMagic) != 0) return false;
  if (header.version != kVersion || header.slotBytes != kSlotBytes) return false;
  for (std::size_t at = kSlotBytes; at < bytes.size(); at += kSlotBytes) {
    if (static_cast<unsigned char>(bytes[at + sizeof(std::int64_t)]) > MappedTally::kMaximumKeyBytes)
      return false;
  }
  return true;
}

Expected<Descriptor> openForWriting(const Descriptor& folder, const Path& path) {
  Descriptor file(openat(folder.number(), path.filename().c_str(),
                         O_RDWR | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC, S_IRUSR | S_IWUSR));
  struct stat status {};
  if (!file || fstat(file.number(), &status) != 0) return tl::unexpected(posixError(errno, path.native()));
  if (!S_ISREG(status.st_mode)) return tl::unexpected(posixError(EINVAL, path.native()));
  if (flock(file.number(), LOCK_EX | LOCK_NB) != 0) return tl::unexpected(posixError(errno, path.native()));
  return file;
}

}  // namespace

MappedTally::MappedTally(const Path& path)
    : places_(std::make_unique<std::array<std::atomic<std::uint16_t>, kPlaces>>()) {
  static_assert(sizeof(Slot) == kSlotBytes);
  if (const auto opened = openFile(path); !opened) {
    platformLog().error("counters are kept in memory only: {}", opened.error().description());
    file_ = {};
    mapMemory();
  }
  indexSlots();
}

MappedTally::~MappedTally() {
  munmap(mapping_, kMaximumBytes);
}

Expected<void> MappedTally::openFile(const Path& path) {
  const auto folder = openTrustedFolder(path.parent_path(), MissingFolders::create);
  if (!folder) return tl::unexpected(folder.error());
  auto file = openForWriting(*folder, path);
  if (!file) return tl::unexpected(file.error());
  auto bytes = readWhole(*file, path, kMaximumBytes);
  if (!bytes || (!bytes->empty() && !isOurs<Header>(*bytes))) {
    const std::string name = path.filename();
    platformLog().error("{} is damaged or no counter file; it is kept as {}.damaged", path.native(), name);
    if (renameat(folder->number(), name.c_str(), folder->number(), (name + ".damaged").c_str()) != 0) {
      return tl::unexpected(posixError(errno, path.native()));
    }
    file = openForWriting(*folder, path);
    if (!file) return tl::unexpected(file.error());
    bytes.emplace();
  }
  file_ = *std::move(file);
  capacity_ = bytes->size() / kSlotBytes;
  if (capacity_ < kFirstCapacity) {
    if (auto grown = grow(kFirstCapacity); !grown) return grown;
  }
  void* mapping = mmap(nullptr, kMaximumBytes, PROT_READ | PROT_WRITE, MAP_SHARED, file_.number(), 0);
  if (mapping == MAP_FAILED) return tl::unexpected(posixError(errno, path.native()));
  mapping_ = static_cast<std::byte*>(mapping);
  const Header header{{'S', 'B', 'L', 'T', 'A', 'L', 'L', 'Y'}, kVersion, kSlotBytes};
  std::memcpy(mapping_, &header, sizeof header);
  return {};
}

/// Blocks are reserved now: on a full disk it is this that fails, not a later addition (SIGBUS).
Expected<void> MappedTally::grow(std::size_t slots) {
  if (file_) {
    const int number = posix_fallocate(file_.number(), 0, static_cast<off_t>(slots * kSlotBytes));
    if (number != 0) return tl::unexpected(posixError(number, "growing the counter file"));
  }
  capacity_ = slots;
  return {};
}

void MappedTally::mapMemory() {
  void* mapping = mmap(nullptr, kMaximumBytes, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  if (mapping == MAP_FAILED) throw std::bad_alloc();
  mapping_ = static_cast<std::byte*>(mapping);
  capacity_ = kMaximumSlots;
}

void MappedTally::indexSlots() {
  // After a power cut a page may be missing between others: its slots stay free, not reused.
  std::size_t used = 1;
  for (std::size_t number = 1; file_ && number < capacity_; ++number) {
    if (slot(number)->length == 0) continue;
    used = number + 1;
    index(number);
  }
  used_ = used;
}

MappedTally::Slot* MappedTally::slot(std::size_t number) const {
  return reinterpret_cast<Slot*>(mapping_ + number * kSlotBytes);
}

/// The place that holds the key's slot number, or the free one where it belongs.
std::size_t MappedTally::find(std::string_view key) const {
  std::size_t place = std::hash<std::string_view>{}(key) % kPlaces;
  while (const std::uint16_t number = (*places_)[place].load(std::memory_order_acquire)) {
    if (slot(number)->name() == key) break;
    place = (place + 1) % kPlaces;
  }
  return place;
}

void MappedTally::index(std::size_t number) {
  auto& place = (*places_)[find(slot(number)->name())];
  place.store(static_cast<std::uint16_t>(number), std::memory_order_release);
}

std::size_t MappedTally::insert(std::string_view key) {
  const std::lock_guard lock(insertion_);
  if (const std::uint16_t known = (*places_)[find(key)]) return known;
  const std::size_t number = used_;
  if (number >= kMaximumSlots) {
    reportOnce("there are too many");
    return 0;
  }
  if (number >= capacity_) {
    if (const auto grown = grow(std::min(capacity_ * 2, kMaximumSlots)); !grown) {
      reportOnce(grown.error().description());
      return 0;
    }
  }
  Slot* fresh = slot(number);
  fresh->value = 0;
  std::memcpy(fresh->key, key.data(), key.size());
  std::atomic_ref(fresh->length).store(static_cast<std::uint8_t>(key.size()), std::memory_order_release);
  used_.store(number + 1, std::memory_order_release);
  index(number);
  return number;
}

MappedTally::Slot* MappedTally::findOrInsert(std::string_view key) {
  if (key.empty() || key.size() > kMaximumKeyBytes) {
    reportOnce("a key is empty or too long");
    return nullptr;
  }
  std::size_t number = (*places_)[find(key)].load(std::memory_order_acquire);
  if (number == 0) number = insert(key);
  return number == 0 ? nullptr : slot(number);
}

void MappedTally::add(std::string_view key, std::int64_t value) {
  if (Slot* found = findOrInsert(key)) {
    std::atomic_ref(found->value).fetch_add(value, std::memory_order_relaxed);
  }
}

void MappedTally::set(std::string_view key, std::int64_t value) {
  if (Slot* found = findOrInsert(key)) {
    std::atomic_ref(found->value).store(value, std::memory_order_relaxed);
  }
}

std::map<std::string, std::int64_t> MappedTally::snapshot() const {
  std::map<std::string, std::int64_t> counters;
  const std::size_t used = used_.load(std::memory_order_acquire);
  for (std::size_t number = 1; number < used; ++number) {
    Slot* found = slot(number);
    if (found->length == 0) continue;
    counters.emplace(found->name(), std::atomic_ref(found->value).load(std::memory_order_relaxed));
  }
  return counters;
}

Expected<std::map<std::string, std::int64_t>> MappedTally::snapshotOf(const Path& path) {
  const auto file = openTrustedFile(path, LastLink::refuse);
  if (!file) return tl::unexpected(file.error());
  const auto bytes = readWhole(*file, path, kMaximumBytes);
  if (!bytes) return tl::unexpected(bytes.error());
  if (!isOurs<Header>(*bytes))
    return tl::unexpected(posixError(EINVAL, path.native() + " is no counter file"));
  std::map<std::string, std::int64_t> counters;
  for (std::size_t at = kSlotBytes; at < bytes->size(); at += kSlotBytes) {
    Slot found{};
    std::memcpy(&found, bytes->data() + at, sizeof found);
    if (found.length != 0) counters.emplace(found.name(), found.value);
  }
  return counters;
}

void MappedTally::reportOnce(std::string_view what) {
  if (!reported_.exchange(true)) platformLog().error("some counters are not kept: {}", what);
}

}  // namespace sable::platform::host
