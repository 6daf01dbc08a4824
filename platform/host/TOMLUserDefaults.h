#pragma once

#include <memory>

#include "platform/FileManager.h"
#include "platform/UserDefaults.h"
#include "platform/host/Folders.h"
#include "platform/host/Reactor.h"

namespace sable::platform::host {

/// Settings in TOML files: the profile's, the user's, and the daemon's own in the state folder
/// (Folders names them). The first two are read again when they change; the last is read once and
/// replaced a second after a value was set, and by synchronize(). A shared domain's file, DOMAIN.toml
/// in the config folder, is read when it is asked for.
class TOMLUserDefaults final : public UserDefaults {
 public:
  /// All that is named must outlive this.
  TOMLUserDefaults(const Folders& folders, Runtime& runtime, Reactor& reactor, FileManager& fileManager);
  /// Writes what is pending.
  ~TOMLUserDefaults() override;

  /// Whether a file that people write could be read when it was last looked at.
  bool isReadable() const;

  void registerDefaults(const Dictionary& object) override;

  std::optional<bool> boolean(std::string_view key) const override;
  std::optional<std::int64_t> integer(std::string_view key) const override;
  std::optional<double> number(std::string_view key) const override;
  std::optional<std::string> string(std::string_view key) const override;
  std::optional<WallTime> date(std::string_view key) const override;
  std::optional<Dictionary> array(std::string_view key) const override;
  std::optional<Dictionary> dictionary(std::string_view key) const override;
  std::optional<bool> sharedBoolean(std::string_view domain, std::string_view key) const override;

  void set(std::string_view key, const Dictionary& value) override;
  void setDate(std::string_view key, WallTime value) override;
  void synchronize() override;

 private:
  class Store;
  std::shared_ptr<Store> store_;
};

}  // namespace sable::platform::host
