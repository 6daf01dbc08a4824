#pragma once

#include <memory>
#include <string>
#include <utility>

namespace sable {

/// Immutable bytes that several owners may hold (an HTTP body is cached, parsed and replied without
/// a copy). Null means "no data", which differs from empty data.
using Data = std::shared_ptr<const std::string>;

inline Data makeData(std::string bytes) {
  return std::make_shared<const std::string>(std::move(bytes));
}

}  // namespace sable
