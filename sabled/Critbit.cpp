#include "sabled/Critbit.h"

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <memory_resource>
#include <new>
#include <string_view>
#include <vector>

namespace sable {
namespace {

using Reference = char*;

constexpr std::uintptr_t kInternalTag = 1;

struct InternalNode {
  Reference child[2];
  std::uint32_t byte;
  std::uint8_t otherBits;
};
static_assert(sizeof(InternalNode) == kCritbitInternalNodeBytes && alignof(InternalNode) == 8);

struct ExternalNode {
  void* value;

  char* key() { return reinterpret_cast<char*>(this + 1); }
};
static_assert(sizeof(ExternalNode) + 1 == kCritbitExternalNodeBytes);

bool isInternal(Reference reference) {
  return (reinterpret_cast<std::uintptr_t>(reference) & kInternalTag) != 0;
}
InternalNode* internalNode(Reference reference) {
  return reinterpret_cast<InternalNode*>(reference - kInternalTag);
}
ExternalNode* externalNode(Reference reference) {
  return reinterpret_cast<ExternalNode*>(reference);
}
Reference referenceTo(InternalNode* node) {
  return reinterpret_cast<Reference>(node) + kInternalTag;
}

unsigned direction(std::uint8_t otherBits, char byte) {
  return (1u + (otherBits | static_cast<std::uint8_t>(byte))) >> 8;
}

/// Where `key` goes at `node`; past its end a key reads as zero.
unsigned direction(const InternalNode& node, std::string_view key) {
  return direction(node.otherBits, node.byte < key.size() ? key[node.byte] : '\0');
}

/// The one external node that may hold `key`, below a reference that is not null.
ExternalNode* find_next_external_node(Reference reference, std::string_view key) {
  while (isInternal(reference)) {
    const InternalNode& node = *internalNode(reference);
    reference = node.child[direction(node, key)];
  }
  return externalNode(reference);
}

ExternalNode* new_external_node(std::string_view key, void* value) {
  void* block = std::malloc(key.size() + kCritbitExternalNodeBytes);
  if (block == nullptr) return nullptr;
  auto* node = ::new (block) ExternalNode{value};
  std::memcpy(node->key(), key.data(), key.size() + 1);
  return node;
}

InternalNode* newInternalNode() {
  void* block = std::malloc(sizeof(InternalNode));
  return block == nullptr ? nullptr : ::new (block) InternalNode;
}

void release(const critbit_tree& tree, void* value) {
  if (tree.value_release != nullptr) tree.value_release(value);
}

/// All but the highest set bit of `difference`, complemented.
std::uint8_t otherBitsOf(std::uint8_t difference) {
  unsigned bits = difference;
  bits |= bits >> 1;
  bits |= bits >> 2;
  bits |= bits >> 4;
  return static_cast<std::uint8_t>(255 - (bits & ~(bits >> 1)));
}

/// The reference at which a node for this bit belongs: bits further left stand further up.
Reference* placeFor(Reference* place, std::string_view key, std::uint32_t byte, std::uint8_t otherBits) {
  while (isInternal(*place)) {
    InternalNode& node = *internalNode(*place);
    if (node.byte > byte || (node.byte == byte && node.otherBits > otherBits)) break;
    place = &node.child[direction(node, key)];
  }
  return place;
}

int insertFirst(critbit_tree* tree, std::string_view key, void* value) {
  ExternalNode* node = new_external_node(key, value);
  if (node == nullptr) return 0;
  tree->root = reinterpret_cast<Reference>(node);
  ++tree->count;
  return 2;
}

int insertBeside(critbit_tree* tree, char* neighbour, std::size_t at, std::string_view key, void* value) {
  const auto difference = static_cast<std::uint8_t>(neighbour[at] ^ key.data()[at]);
  const std::uint8_t otherBits = otherBitsOf(difference);
  const unsigned neighboursSide = direction(otherBits, neighbour[at]);
  ExternalNode* external = new_external_node(key, value);
  InternalNode* internal = external == nullptr ? nullptr : newInternalNode();
  if (internal == nullptr) {
    std::free(external);
    return 0;
  }
  internal->byte = static_cast<std::uint32_t>(at);
  internal->otherBits = otherBits;
  Reference* place = placeFor(&tree->root, key, internal->byte, otherBits);
  internal->child[1 - neighboursSide] = reinterpret_cast<Reference>(external);
  internal->child[neighboursSide] = *place;
  *place = referenceTo(internal);
  ++tree->count;
  return 2;
}

/// Frees everything below a reference that is not null. Turns the tree until its first key hangs from
/// the top, takes that off, and goes on: deep trees cost time, no stack.
void traverse(const critbit_tree& tree, Reference top) {
  while (isInternal(top)) {
    InternalNode* node = internalNode(top);
    const Reference first = node->child[0];
    if (isInternal(first)) {
      node->child[0] = internalNode(first)->child[1];
      internalNode(first)->child[1] = top;
      top = first;
    } else {
      release(tree, externalNode(first)->value);
      std::free(externalNode(first));
      top = node->child[1];
      std::free(node);
    }
  }
  release(tree, externalNode(top)->value);
  std::free(externalNode(top));
}

/// Visits everything below a reference that is not null, child 0 first. What is still to come is on the
/// heap only where a hostile choice of keys makes the tree deep.
void allprefixed_traverse(Reference top, prefix_callback callback, void* context) {
  constexpr std::size_t kUsualDepth = 64;
  alignas(Reference) std::byte room[kUsualDepth * sizeof(Reference)];
  std::pmr::monotonic_buffer_resource memory(room, sizeof room);
  std::pmr::vector<Reference> pending(&memory);
  pending.reserve(kUsualDepth);
  for (;;) {
    while (isInternal(top)) {
      const InternalNode& node = *internalNode(top);
      pending.push_back(node.child[1]);
      top = node.child[0];
    }
    callback(externalNode(top)->key(), externalNode(top)->value, context);
    if (pending.empty()) return;
    top = pending.back();
    pending.pop_back();
  }
}

}  // namespace

bool critbit_contains(const critbit_tree* tree, const char* key, void** value) {
  if (tree->root == nullptr) return false;
  ExternalNode* node = find_next_external_node(tree->root, key);
  if (std::strcmp(node->key(), key) != 0) return false;
  if (value != nullptr) *value = node->value;
  return true;
}

int critbit_insert(critbit_tree* tree, const char* text, void* value, bool replace) {
  const std::string_view key = text;
  if (key.size() >= UINT32_MAX) return 0;
  if (tree->root == nullptr) return insertFirst(tree, key, value);
  ExternalNode* closest = find_next_external_node(tree->root, key);
  for (std::size_t i = 0; i <= key.size(); ++i) {
    if (closest->key()[i] != text[i]) return insertBeside(tree, closest->key(), i, key, value);
  }
  if (closest->value == value) return 0;
  if (replace) {
    release(*tree, closest->value);
    closest->value = value;
  }
  return 1;
}

bool critbit_delete(critbit_tree* tree, const char* text) {
  if (tree->root == nullptr) return false;
  const std::string_view key = text;
  Reference* place = &tree->root;
  Reference* parentsPlace = nullptr;
  unsigned side = 0;
  while (isInternal(*place)) {
    InternalNode& node = *internalNode(*place);
    side = direction(node, key);
    parentsPlace = place;
    place = &node.child[side];
  }
  ExternalNode* found = externalNode(*place);
  if (std::strcmp(found->key(), text) != 0) return false;
  if (parentsPlace == nullptr) {
    tree->root = nullptr;
  } else {
    InternalNode* parent = internalNode(*parentsPlace);
    *parentsPlace = parent->child[1 - side];
    std::free(parent);
  }
  --tree->count;
  release(*tree, found->value);
  std::free(found);
  return true;
}

void critbit_clear(critbit_tree* tree) {
  if (tree->root != nullptr) traverse(*tree, tree->root);
  tree->root = nullptr;
  tree->count = 0;
}

void critbit_allprefixed(const critbit_tree* tree, const char* text, prefix_callback callback,
                         void* context) {
  if (tree->root == nullptr) return;
  const std::string_view prefix = text;
  Reference top = tree->root, reached = top;
  while (isInternal(reached)) {
    const InternalNode& node = *internalNode(reached);
    reached = node.child[direction(node, prefix)];
    if (node.byte < prefix.size()) top = reached;
  }
  if (std::strncmp(externalNode(reached)->key(), text, prefix.size()) == 0) {
    allprefixed_traverse(top, callback, context);
  }
}

}  // namespace sable
