// A crit-bit tree: a map from NUL-terminated byte strings to object pointers with exact look-up,
// insert-or-replace, delete, clear and ascending enumeration of every key with a given prefix.
//
// Two layers. The C-style functions work on a small tree record and store raw value pointers,
// handing each value the tree lets go of to the record's release function. CritbitTree wraps one
// record and holds exactly one reference per stored RefCounted value.
//
// Threading: none inside. The owner serialises every call (the query cache does so on its queue).
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <string>
#include <string_view>

#include "cache/ref_counted.h"

namespace tavix {

// The tree record. `root` is a tagged node pointer: low bit 0 is an external (leaf) node, low bit 1
// is an internal node at root - 1. Nodes are 8-byte aligned so the low bit of an address is free.
struct critbit_tree {
  std::uintptr_t root = 0;
  std::uint64_t count = 0;
  void (*release)(void* value) = nullptr;  // called on every value the tree drops; may be null
};

// Leaf: the value, then the key bytes and their terminating zero, inline (key length + 9 bytes).
struct critbit_external_node {
  void* value;
  char key[1];
};

// Branch: the two children, the index of the critical byte and a mask with every bit set but
// the critical bit.
struct critbit_internal_node {
  std::uintptr_t child[2];
  std::uint32_t byte;
  std::uint8_t otherbits;
};

// Enumeration callback: the stored key (valid only during the call) and the caller's argument.
// Returns 1 to go on, 0 to stop; anything else aborts the enumeration with an error.
using critbit_callback = int (*)(const char* key, void* arg);

// 1 if `key` is present (its value written to *value when value is non-null), 0 otherwise.
int critbit_contains(critbit_tree* tree, const char* key, void** value);
// 2: new key added. 1: the key held another value (replaced, releasing the old one, when bit 0 of
// `replace` is set; left alone otherwise). 0: the key already held this very value, or an
// allocation failed; the tree is unchanged.
int critbit_insert(critbit_tree* tree, const char* key, void* value, int replace);
// 1 if the key was found and removed (its value released), 0 otherwise.
int critbit_delete(critbit_tree* tree, const char* key);
// Releases every value and frees every node; root null and count 0 afterwards.
void critbit_clear(critbit_tree* tree);
// Calls `callback` on every key that begins with `prefix`, in ascending unsigned bytewise order.
// 1 when the walk ran to its end (or nothing matched), 0 when the callback stopped it, -1 when the
// callback returned something other than 0 or 1.
int critbit_allprefixed(critbit_tree* tree, const char* prefix, critbit_callback callback, void* arg);

// Internals, exposed for tests.
critbit_external_node* find_next_external_node(std::uintptr_t root, const std::uint8_t* key, std::size_t len);
critbit_external_node* new_external_node(const std::uint8_t* key, std::size_t len, void* value);
void traverse(critbit_tree* tree, std::uintptr_t node);
int allprefixed_traverse(std::uintptr_t node, critbit_callback callback, void* arg);

// The reference-holding wrapper. Keys are UTF-8 strings; a key ends at its first zero byte.
class CritbitTree {
 public:
  // The visitor gets a key that is valid only during the call (copy it to keep it) and may set
  // *stop to end the walk.
  using Visitor = std::function<void(std::string_view key, bool* stop)>;

  CritbitTree();
  ~CritbitTree();  // releases every stored value
  CritbitTree(const CritbitTree&) = delete;
  CritbitTree& operator=(const CritbitTree&) = delete;

  // Stores `object` under `key`, replacing (and releasing) another object stored there. Storing
  // the object already held under that key changes nothing. A null object is not stored.
  void setObject(const Ref<RefCounted>& object, const std::string& key);
  void removeObjectForKey(const std::string& key);
  void removeAllObjects();
  // The object stored under `key`, or null.
  Ref<RefCounted> objectForKey(const std::string& key);
  // Visits every key that begins with `prefix`, ascending bytewise.
  void keysMatchingPrefix(const std::string& prefix, const Visitor& visitor);
  std::uint64_t count() const { return _tree.count; }

 private:
  critbit_tree _tree;
};

}  // namespace tavix
