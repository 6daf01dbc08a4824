#include "platform/host/TOMLUserDefaults.h"

#include <array>
#include <mutex>
#include <nlohmann/json.hpp>
#include <set>
#include <shared_mutex>

#include "platform/Log.h"
#include "platform/host/ConfigurationSchema.h"
#include "platform/host/FileWatcher.h"

namespace sable::platform::host {

namespace {

/// How long a value that was set may wait for others before it is written.
constexpr Duration kWriteDelay = std::chrono::seconds(1);

bool same(const TOMLValue& a, const TOMLValue& b) {
  return a.date == b.date && *a.value == *b.value;
}

}  // namespace

/// The four layers and the writing of the daemon's own. Any thread.
class TOMLUserDefaults::Store : public std::enable_shared_from_this<Store> {
 public:
  Store(const Folders& folders, Runtime& runtime, FileManager& fileManager)
      : fileManager_(fileManager),
        queue_(runtime.serialQueue("com.kestrel.sabled.defaults", QualityOfService::background)),
        folders_(folders),
        profile_(folders.profileSettings),
        user_(folders.userSettings()),
        ownPath_(folders.ownSettings()) {
    TOMLFile own(ownPath_);
    own.reload();
    own_ = own.content();
    if (own.isDamaged()) keepDamaged();
  }

  void watch(Reactor& reactor) {
    watcher_ = std::make_unique<FileWatcher>(reactor, std::vector{profile_.path(), user_.path()},
                                             [this] { reload(); });
    reload();
  }

  bool isReadable() const {
    const std::shared_lock lock(mutex_);
    return !profile_.isDamaged() && !user_.isDamaged();
  }

  void registerDefaults(const Dictionary& object) {
    const std::unique_lock lock(mutex_);
    for (const auto& [key, value] : object.items()) {
      registered_[key] = TOMLValue{std::make_shared<const Dictionary>(value), {}, 0, 0};
    }
  }

  /// The value of the first layer that has the key with that type.
  std::optional<TOMLValue> find(std::string_view key, ValueType type) const {
    const std::shared_lock lock(mutex_);
    const std::array layers{std::pair{&profile_.content(), &profile_.path()},
                            std::pair{&user_.content(), &user_.path()}, std::pair{&own_, &ownPath_},
                            std::pair{&registered_, static_cast<const std::filesystem::path*>(nullptr)}};
    for (const auto& [layer, path] : layers) {
      const auto found = layer->find(key);
      if (found == layer->end()) continue;
      if (hasType(found->second, type)) return found->second;
      reportType(key, found->second, type, path);
    }
    return std::nullopt;
  }

  std::optional<bool> findShared(std::string_view domain, std::string_view key) {
    const std::lock_guard lock(sharing_);
    auto known = shared_.find(domain);
    if (known == shared_.end())
      known = shared_.emplace(domain, TOMLFile(folders_.sharedSettings(domain))).first;
    TOMLFile& file = known->second;
    file.reload();
    const auto found = file.content().find(key);
    if (found == file.content().end()) return std::nullopt;
    if (found->second.value->is_boolean()) return found->second.value->get<bool>();
    reportType(key, found->second, ValueType::boolean, &file.path());
    return std::nullopt;
  }

  void set(std::string_view key, TOMLValue value) {
    const std::unique_lock lock(mutex_);
    const auto found = own_.find(key);
    if (value.value->is_null()) {
      if (found == own_.end()) return;
      own_.erase(found);
    } else {
      if (found != own_.end() && same(found->second, value)) return;
      own_.insert_or_assign(std::string(key), std::move(value));
    }
    pending_ = true;
    if (!std::exchange(scheduled_, true)) {
      timer_ = queue_->after(kWriteDelay, [weak = weak_from_this()] {
        if (const auto store = weak.lock()) store->write();
      });
    }
  }

  void write() {
    const std::lock_guard turn(writing_);
    std::string text;
    {
      const std::unique_lock lock(mutex_);
      timer_.cancel();
      scheduled_ = false;
      if (!std::exchange(pending_, false)) return;
      text = formatTOML(own_);
    }
    auto written = fileManager_.createDirectory(ownPath_.parent_path());
    if (written) written = fileManager_.writeAtomically(ownPath_, text);
    if (!written) {
      if (!failed_) platformLog().error("settings cannot be written: {}", written.error().description());
      const std::unique_lock lock(mutex_);
      pending_ = true;  // for the next set() or synchronize()
    }
    failed_ = !written;
  }

 private:
  void reload() {
    // The files are replaced only here, so that they can be read without making readers wait.
    const std::lock_guard turn(reloading_);
    TOMLFile profile = profile_, user = user_;
    const bool profileChanged = profile.reload();
    const bool changed = user.reload() || profileChanged;
    const std::unique_lock lock(mutex_);
    profile_ = std::move(profile);
    user_ = std::move(user);
    if (changed) reported_.clear();
  }

  /// The next write would lose a file that a person may still mend.
  void keepDamaged() {
    std::error_code error;
    auto aside = ownPath_;
    std::filesystem::rename(ownPath_, aside += ".damaged", error);
    if (!error) platformLog().error("{} is kept as {}", ownPath_.native(), aside.native());
  }

  void reportType(std::string_view key, const TOMLValue& value, ValueType type,
                  const std::filesystem::path* path) const {
    const std::lock_guard lock(reporting_);
    if (!reported_.emplace(key).second) return;
    if (path != nullptr) {
      platformLog().error("{}:{}:{}: {} is not {}; it counts as absent", path->native(), value.line,
                          value.column, key, typeName(type));
    } else {
      platformLog().error("the registered default of {} is not {}", key, typeName(type));
    }
  }

  FileManager& fileManager_;
  const std::shared_ptr<SerialQueue> queue_;

  std::mutex reloading_;

  const Folders folders_;
  std::mutex sharing_;
  std::map<std::string, TOMLFile, std::less<>> shared_;  ///< by domain

  mutable std::shared_mutex mutex_;
  TOMLFile profile_, user_;
  const std::filesystem::path ownPath_;
  TOMLContent own_, registered_;
  bool pending_ = false;    ///< something is to be written
  bool scheduled_ = false;  ///< and the timer will see to it
  Timer timer_;

  mutable std::mutex reporting_;
  mutable std::set<std::string, std::less<>> reported_;

  std::mutex writing_;
  bool failed_ = false;

  std::unique_ptr<FileWatcher> watcher_;
};

TOMLUserDefaults::TOMLUserDefaults(const Folders& folders, Runtime& runtime, Reactor& reactor,
                                   FileManager& fileManager)
    : store_(std::make_shared<Store>(folders, runtime, fileManager)) {
  store_->watch(reactor);
}

TOMLUserDefaults::~TOMLUserDefaults() {
  store_->write();
}

bool TOMLUserDefaults::isReadable() const {
  return store_->isReadable();
}

void TOMLUserDefaults::registerDefaults(const Dictionary& object) {
  store_->registerDefaults(object);
}

std::optional<bool> TOMLUserDefaults::boolean(std::string_view key) const {
  const auto found = store_->find(key, ValueType::boolean);
  return found ? std::optional(found->value->get<bool>()) : std::nullopt;
}

std::optional<std::int64_t> TOMLUserDefaults::integer(std::string_view key) const {
  const auto found = store_->find(key, ValueType::integer);
  return found ? std::optional(found->value->get<std::int64_t>()) : std::nullopt;
}

std::optional<double> TOMLUserDefaults::number(std::string_view key) const {
  const auto found = store_->find(key, ValueType::number);
  return found ? std::optional(found->value->get<double>()) : std::nullopt;
}

std::optional<std::string> TOMLUserDefaults::string(std::string_view key) const {
  const auto found = store_->find(key, ValueType::string);
  return found ? std::optional(found->value->get<std::string>()) : std::nullopt;
}

std::optional<WallTime> TOMLUserDefaults::date(std::string_view key) const {
  const auto found = store_->find(key, ValueType::date);
  return found ? found->date : std::nullopt;
}

std::optional<Dictionary> TOMLUserDefaults::array(std::string_view key) const {
  const auto found = store_->find(key, ValueType::array);
  return found ? std::optional(*found->value) : std::nullopt;
}

std::optional<Dictionary> TOMLUserDefaults::dictionary(std::string_view key) const {
  const auto found = store_->find(key, ValueType::table);
  return found ? std::optional(*found->value) : std::nullopt;
}

std::optional<bool> TOMLUserDefaults::sharedBoolean(std::string_view domain, std::string_view key) const {
  return store_->findShared(domain, key);
}

void TOMLUserDefaults::set(std::string_view key, const Dictionary& value) {
  store_->set(key, TOMLValue{std::make_shared<const Dictionary>(value), {}, 0, 0});
}

void TOMLUserDefaults::setDate(std::string_view key, WallTime value) {
  store_->set(key, TOMLValue{std::make_shared<const Dictionary>(secondsSince1970(value)), value, 0, 0});
}

void TOMLUserDefaults::synchronize() {
  store_->write();
}

}  // namespace sable::platform::host
