#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace sable {

/// How a request came about: what each step of its making offered, in order, and what became of it.
/// A builder that is given one fills it on the way; nothing is noted otherwise.
class RequestTrace {
 public:
  enum class Place { queryItem, header };
  enum class Effect {
    set,       ///< nothing of that name was there
    replaced,  ///< took the place of what another step had set
    kept,      ///< gave way to what another step had set
  };

  struct Entry {
    Place place;
    std::string step;
    std::string name;
    std::string value;
    Effect effect;
    std::string otherStep;   ///< unless `set`: who had set what was there
    std::string otherValue;  ///< unless `set`: what was there
  };

  /// What is noted from here on belongs to `step`.
  void beginStep(std::string_view step);
  /// A value that is set, in place of `found` if something of the name was there.
  void noteForced(Place place, std::string_view name, std::string_view value,
                  const std::optional<std::string>& found);
  /// A value that is set only if nothing of the name was `found`.
  void noteDefault(Place place, std::string_view name, std::string_view value,
                   const std::optional<std::string>& found);

  const std::vector<Entry>& entries() const { return entries_; }
  /// Steps that had nothing to add ("_addLocationQueryItem" without a location).
  std::vector<std::string> silentSteps() const;

 private:
  void note(Place place, std::string_view name, std::string_view value,
            const std::optional<std::string>& found, Effect effectWhenFound);
  std::string holderOf(Place place, std::string_view name) const;

  std::vector<std::string> steps_;
  std::vector<Entry> entries_;
};

}  // namespace sable
