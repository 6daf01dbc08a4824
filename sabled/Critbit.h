#pragma once

#include <cstddef>

/// A crit-bit tree: a map from C strings to pointers that keeps its keys in the order of their bytes
/// and finds all that begin alike in one walk. A binary tree in which every internal node names the
/// one bit that its two subtrees disagree about, so a lookup looks at a few bits of the key and
/// compares the whole of it once.
///
///   internal node   child 0 (8) | child 1 (8) | byte index (4) | other bits (1) | padding (3)
///   external node   value (8) | key | 0
///
/// "Other bits" is the complement of the one bit that counts within its byte. A reference is a
/// node's address; for internal nodes the lowest bit, which alignment leaves free, is set. A tree of n keys
/// has n external and n - 1 internal nodes, so a key costs its length and 33 bytes.
///
/// Any bytes but zero may stand in a key, which ends at the first zero; keys may be prefixes of one
/// another, and one of 4 GiB is refused. However deep the tree, nothing recurses. No locking.
namespace sable {

struct critbit_tree {
  char* root = nullptr;  ///< a reference; null: empty
  std::size_t count = 0;
  /// Called with a value that is replaced or removed; may be null. Must not touch the tree.
  void (*value_release)(void* value) = nullptr;
};

inline constexpr std::size_t kCritbitInternalNodeBytes = 24;
inline constexpr std::size_t kCritbitExternalNodeBytes = 9;  ///< and the key's

/// Whether `key` is there; then `*value` is its value, unless `value` is null.
bool critbit_contains(const critbit_tree* tree, const char* key, void** value);

/// 0: no memory, or the key has this very value already. 1: the key has another value, which is
/// released and replaced only with `replace`. 2: the key was new.
int critbit_insert(critbit_tree* tree, const char* key, void* value, bool replace);

/// Releases the value of `key` and forgets it; false when it was not there.
bool critbit_delete(critbit_tree* tree, const char* key);

/// Releases every value; the tree is empty afterwards.
void critbit_clear(critbit_tree* tree);

/// `key` and `value` are the tree's. Must not change the tree.
using prefix_callback = void (*)(const char* key, void* value, void* context);

/// Calls `callback` for each key that begins with `prefix` ("": every key), in byte-wise order.
void critbit_allprefixed(const critbit_tree* tree, const char* prefix, prefix_callback callback,
                         void* context);

}  // namespace sable
