#pragma once

#include <cstddef>
#include <memory>
#include <string>
#include <utility>

#include "sabled/Critbit.h"

namespace sable {

/// Maps UTF-8 text to objects that it shares with others, in the order of the text's bytes. A text
/// with a zero byte is no key: it is never stored, and nothing is found under it. An entry takes 49
/// bytes besides its key: 33 of the tree and a shared pointer. One thread at a time.
template <class Object>
class CritbitTree {
 public:
  using Value = std::shared_ptr<Object>;

  CritbitTree() { tree_.value_release = release; }
  ~CritbitTree() { removeAllObjects(); }
  CritbitTree(const CritbitTree&) = delete;
  CritbitTree& operator=(const CritbitTree&) = delete;

  static bool isKey(const std::string& text) { return text.find('\0') == std::string::npos; }

  /// Adds an object or puts it in the place of the key's former one; false for what is no key, and
  /// when there is no memory.
  bool setObject(Value object, const std::string& key) {
    if (!isKey(key)) return false;
    auto value = std::make_unique<Value>(std::move(object));
    if (critbit_insert(&tree_, key.c_str(), value.get(), true) == 0) return false;
    (void)value.release();  // the tree's, until it releases it
    return true;
  }

  void removeObjectForKey(const std::string& key) {
    if (isKey(key)) critbit_delete(&tree_, key.c_str());
  }
  void removeAllObjects() { critbit_clear(&tree_); }

  /// Null when there is none.
  Value objectForKey(const std::string& key) const {
    void* value = nullptr;
    return isKey(key) && critbit_contains(&tree_, key.c_str(), &value) ? *static_cast<Value*>(value)
                                                                       : Value();
  }

  /// Calls `block(const char* key, const Value& object)` once for each key that begins with `prefix`
  /// ("": every key), in order. What it is given is the tree's own; it must not change the tree.
  template <class Block>
  void keysMatchingPrefix(const std::string& prefix, Block&& block) const {
    if (!isKey(prefix)) return;
    using Callable = std::remove_reference_t<Block>;
    critbit_allprefixed(
        &tree_, prefix.c_str(),
        [](const char* key, void* value, void* context) {
          (*static_cast<Callable*>(context))(key, std::as_const(*static_cast<Value*>(value)));
        },
        &block);
  }

  std::size_t count() const { return tree_.count; }

 private:
  static void release(void* value) { delete static_cast<Value*>(value); }

  critbit_tree tree_;
};

}  // namespace sable
