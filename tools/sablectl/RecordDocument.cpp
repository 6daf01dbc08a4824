#include "tools/sablectl/RecordDocument.h"

#include <fmt/format.h>

#include <algorithm>
#include <nlohmann/json.hpp>

#include "tools/sablectl/Output.h"
#include "tools/sablectl/Text.h"

namespace sable::sablectl {
namespace {

struct ValueDocument {
  Dictionary operator()(std::monostate) const { return nullptr; }
  Dictionary operator()(const Data& data) const {
    return data == nullptr ? Dictionary(nullptr) : sized(data->size());
  }
  Dictionary operator()(const platform::RelayRecord& record) const { return recordDocument(record); }
  Dictionary operator()(const platform::RelayRecords& records) const { return recordDocuments(records); }
  Dictionary operator()(const platform::RelayStringPairs& pairs) const {
    Dictionary array = Dictionary::array();
    for (const auto& [name, value] : pairs.pairs) array.push_back(Dictionary::array({name, value}));
    return array;
  }
  Dictionary operator()(const platform::RelayStringMap& map) const {
    Dictionary object = Dictionary::object();
    for (const auto& [name, value] : map.entries) object[name] = value;
    return object;
  }
  Dictionary operator()(const platform::RelayDataMap& map) const {
    Dictionary object = Dictionary::object();
    for (const auto& [name, data] : map.entries) object[name] = (*this)(data);
    return object;
  }
  Dictionary operator()(const platform::RelayFile&) const { return "file"; }
  template <class Plain>
  Dictionary operator()(const Plain& value) const {
    return value;
  }

 private:
  static Dictionary sized(std::size_t size) { return fmt::format("{} bytes", size); }
};

}  // namespace

Dictionary recordDocument(const platform::RelayRecord& record) {
  Dictionary object = Dictionary::object();
  for (const auto& [name, value] : record.members())
    object[name] = std::visit(ValueDocument(), static_cast<const platform::RelayValue::variant&>(value));
  return object;
}

Dictionary recordDocuments(const platform::RelayRecords& records) {
  Dictionary array = Dictionary::array();
  for (const auto& record : records) array.push_back(recordDocument(record));
  return array;
}

std::vector<std::string> tableLines(const Dictionary& objects) {
  if (objects.empty()) return {"none"};
  std::vector<std::string> keys;
  for (const Dictionary& object : objects) {
    for (const auto& [key, value] : object.items()) {
      if (std::ranges::find(keys, key) == keys.end()) keys.push_back(key);
    }
  }
  std::vector<std::vector<std::string>> rows(1);
  for (const std::string& key : keys) rows[0].push_back(printable(key));
  for (const Dictionary& object : objects) {
    auto& row = rows.emplace_back();
    for (const std::string& key : keys) row.push_back(object.contains(key) ? plainText(object[key]) : "");
  }
  return aligned(rows);
}

}  // namespace sable::sablectl
