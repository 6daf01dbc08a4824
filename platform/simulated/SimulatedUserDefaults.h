#pragma once

#include <array>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <utility>

#include "platform/UserDefaults.h"

namespace sable::platform::simulated {

/// Settings in memory, in the same layers as on the host.
class SimulatedUserDefaults final : public UserDefaults {
 public:
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
  void synchronize() override { ++synchronizations_; }

  /// What the user or the profile sets; null takes it back.
  void setByUser(std::string_view key, const Dictionary& value) { put(user, key, value); }
  void setByProfile(std::string_view key, const Dictionary& value) { put(profile, key, value); }

  /// A setting of a domain that programs share.
  void setShared(std::string_view domain, std::string_view key, bool value) {
    shared_[{std::string(domain), std::string(key)}] = value;
  }

  int synchronizations() const { return synchronizations_; }

 private:
  enum Layer { profile, user, own, registered };
  struct Value {
    std::shared_ptr<const Dictionary> value;
    std::optional<WallTime> date;
  };

  void put(Layer layer, std::string_view key, const Dictionary& value);
  template <class Is>
  const Value* find(std::string_view key, std::string_view type, Is is) const;

  std::array<std::map<std::string, Value, std::less<>>, 4> layers_;
  std::map<std::pair<std::string, std::string>, bool> shared_;
  mutable std::set<std::string, std::less<>> reported_;
  int synchronizations_ = 0;
};

}  // namespace sable::platform::simulated
