#pragma once

#include <unistd.h>

#include <memory>
#include <utility>

namespace sable::platform::host {

/// An open file descriptor, closed with its owner; -1 is none.
class Descriptor {
 public:
  Descriptor() = default;
  explicit Descriptor(int number) : number_(number) {}
  Descriptor(Descriptor&& other) noexcept : number_(std::exchange(other.number_, -1)) {}
  Descriptor& operator=(Descriptor&& other) noexcept {
    std::swap(number_, other.number_);
    return *this;
  }
  ~Descriptor() {
    if (number_ >= 0) close(number_);
  }

  int number() const { return number_; }
  explicit operator bool() const { return number_ >= 0; }
  /// The caller's from now on.
  int release() { return std::exchange(number_, -1); }

 private:
  int number_ = -1;
};

/// Held by several, closed with the last of them.
inline std::shared_ptr<const int> sharedDescriptor(Descriptor descriptor) {
  return {new int(descriptor.release()), [](const int* number) {
            close(*number);
            delete number;
          }};
}

}  // namespace sable::platform::host
