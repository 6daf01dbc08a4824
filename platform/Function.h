#pragma once

#include <cstddef>
#include <memory>
#include <new>
#include <type_traits>
#include <utility>

namespace sable::platform {

template <class Signature>
class Function;

/// A callable that is moved, never copied, so that it can own what it answers with (a reply, a
/// transaction). C++23 brings std::move_only_function; until then these few lines stand in.
/// Callables of up to six words are kept in place, as three shared pointers are; larger ones on the heap.
template <class Result, class... Args>
class Function<Result(Args...)> {
 public:
  Function() noexcept = default;
  Function(std::nullptr_t) noexcept {}

  template <class F>
  requires(!std::is_same_v<std::remove_cvref_t<F>, Function> &&
           std::is_invocable_r_v<Result, std::remove_cvref_t<F>&, Args...>) Function(F&& callable) {
    using Callable = std::remove_cvref_t<F>;
    if constexpr (fits<Callable>) {
      ::new (static_cast<void*>(&storage_)) Callable(std::forward<F>(callable));
      operations_ = &inPlace<Callable>;
    } else {
      ::new (static_cast<void*>(&storage_)) Callable*(new Callable(std::forward<F>(callable)));
      operations_ = &onHeap<Callable>;
    }
  }

  Function(Function&& other) noexcept { take(other); }
  Function& operator=(Function&& other) noexcept {
    if (this != &other) {
      reset();
      take(other);
    }
    return *this;
  }
  Function(const Function&) = delete;
  Function& operator=(const Function&) = delete;
  ~Function() { reset(); }

  explicit operator bool() const noexcept { return operations_ != nullptr; }

  /// Calls the callable; calling an empty Function is a programming error.
  Result operator()(Args... args) {
    // NOLINTNEXTLINE(clang-analyzer-core.NullDereference): as said
    return operations_->call(&storage_, std::forward<Args>(args)...);
  }

 private:
  struct Operations {
    Result (*call)(void*, Args&&...);
    void (*move)(void* from, void* to) noexcept;
    void (*destroy)(void*) noexcept;
  };

  static constexpr std::size_t kCapacity = 6 * sizeof(void*);

  template <class Callable>
  static constexpr bool fits =
      sizeof(Callable) <= kCapacity &&
      alignof(Callable) <= alignof(void*) && std::is_nothrow_move_constructible_v<Callable>;

  template <class Callable>
  static constexpr Operations inPlace{[](void* self, Args&&... args) -> Result {
                                        return (*static_cast<Callable*>(self))(std::forward<Args>(args)...);
                                      },
                                      [](void* from, void* to) noexcept {
                                        ::new (to) Callable(std::move(*static_cast<Callable*>(from)));
                                        static_cast<Callable*>(from)->~Callable();
                                      },
                                      [](void* self) noexcept { static_cast<Callable*>(self)->~Callable(); }};

  template <class Callable>
  static constexpr Operations onHeap{
      [](void* self, Args&&... args) -> Result {
        return (**static_cast<Callable**>(self))(std::forward<Args>(args)...);
      },
      [](void* from, void* to) noexcept { ::new (to) Callable*(*static_cast<Callable**>(from)); },
      [](void* self) noexcept { delete *static_cast<Callable**>(self); }};

  void take(Function& other) noexcept {
    if (other.operations_ != nullptr) {
      other.operations_->move(&other.storage_, &storage_);
      operations_ = std::exchange(other.operations_, nullptr);
    }
  }
  void reset() noexcept {
    if (operations_ != nullptr) std::exchange(operations_, nullptr)->destroy(&storage_);
  }

  alignas(void*) std::byte storage_[kCapacity];
  const Operations* operations_ = nullptr;
};

}  // namespace sable::platform
