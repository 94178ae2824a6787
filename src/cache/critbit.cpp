#include "cache/critbit.h"

#include <cstdlib>
#include <cstring>

namespace tavix {
namespace {

constexpr std::size_t kNodeAlignment = 8;

bool isInternal(std::uintptr_t p) { return (p & 1) != 0; }
critbit_internal_node* internalOf(std::uintptr_t p) { return reinterpret_cast<critbit_internal_node*>(p - 1); }
critbit_external_node* externalOf(std::uintptr_t p) { return reinterpret_cast<critbit_external_node*>(p); }

// The key sits right after the value pointer; reached through byte arithmetic so that the
// one-element array in the declaration is never indexed past its bound.
std::uint8_t* keyOf(critbit_external_node* node) {
  return reinterpret_cast<std::uint8_t*>(node) + sizeof(void*);
}

// 1 when the key's byte at the node's critical position has the critical bit set. Bytes past the
// end of the key read as zero.
int direction(const critbit_internal_node* q, const std::uint8_t* key, std::size_t len) {
  std::uint8_t c = q->byte < len ? key[q->byte] : 0;
  return (1 + (q->otherbits | c)) >> 8;
}

void* alignedAlloc(std::size_t size) {
  void* p = nullptr;
  if (posix_memalign(&p, kNodeAlignment, size) != 0) return nullptr;
  return p;
}

}  // namespace

critbit_external_node* find_next_external_node(std::uintptr_t root, const std::uint8_t* key, std::size_t len) {
  std::uintptr_t p = root;
  while (isInternal(p)) {
    critbit_internal_node* q = internalOf(p);
    p = q->child[direction(q, key, len)];
  }
  return externalOf(p);
}

critbit_external_node* new_external_node(const std::uint8_t* key, std::size_t len, void* value) {
  auto* node = static_cast<critbit_external_node*>(alignedAlloc(len + 9));
  if (!node) return nullptr;
  node->value = value;
  std::memcpy(keyOf(node), key, len);
  keyOf(node)[len] = 0;
  return node;
}

int critbit_contains(critbit_tree* tree, const char* key, void** value) {
  if (!tree->root) return 0;
  auto* ukey = reinterpret_cast<const std::uint8_t*>(key);
  critbit_external_node* p = find_next_external_node(tree->root, ukey, std::strlen(key));
  if (std::strcmp(key, reinterpret_cast<const char*>(keyOf(p))) != 0) return 0;
  if (value) *value = p->value;
  return 1;
}

int critbit_insert(critbit_tree* tree, const char* key, void* value, int replace) {
  auto* ukey = reinterpret_cast<const std::uint8_t*>(key);
  const std::size_t ulen = std::strlen(key);

  if (!tree->root) {
    critbit_external_node* node = new_external_node(ukey, ulen, value);
    if (!node) return 0;
    tree->root = reinterpret_cast<std::uintptr_t>(node);
    tree->count += 1;
    return 2;
  }

  critbit_external_node* p = find_next_external_node(tree->root, ukey, ulen);
  const std::uint8_t* pkey = keyOf(p);

  std::uint32_t newbyte = 0;
  std::uint32_t newotherbits = 0;
  bool differs = false;
  for (newbyte = 0; newbyte < ulen; ++newbyte) {
    if (pkey[newbyte] != ukey[newbyte]) {
      newotherbits = pkey[newbyte] ^ ukey[newbyte];
      differs = true;
      break;
    }
  }
  if (!differs && pkey[newbyte] != 0) {
    // The new key is a proper prefix of p's key: they differ against its implicit zero.
    newotherbits = pkey[newbyte];
    differs = true;
  }

  if (!differs) {
    if (p->value == value) return 0;
    if ((replace & 1) == 0) return 1;
    if (tree->release) tree->release(p->value);
    p->value = value;
    return 1;
  }

  newotherbits |= newotherbits >> 1;
  newotherbits |= newotherbits >> 2;
  newotherbits |= newotherbits >> 4;
  newotherbits = ((newotherbits & ~(newotherbits >> 1)) ^ 255) & 0xFF;
  const std::uint8_t c = pkey[newbyte];
  const int newdirection = (1 + (newotherbits | c)) >> 8;

  auto* newnode = static_cast<critbit_internal_node*>(alignedAlloc(sizeof(critbit_internal_node)));
  if (!newnode) return 0;
  critbit_external_node* leaf = new_external_node(ukey, ulen, value);
  if (!leaf) {
    std::free(newnode);
    return 0;
  }
  newnode->byte = newbyte;
  newnode->otherbits = static_cast<std::uint8_t>(newotherbits);
  newnode->child[1 - newdirection] = reinterpret_cast<std::uintptr_t>(leaf);

  std::uintptr_t* wherep = &tree->root;
  for (;;) {
    std::uintptr_t cur = *wherep;
    if (!isInternal(cur)) break;
    critbit_internal_node* q = internalOf(cur);
    if (q->byte > newbyte) break;
    if (q->byte == newbyte && q->otherbits > newotherbits) break;
    wherep = &q->child[direction(q, ukey, ulen)];
  }
  newnode->child[newdirection] = *wherep;
  *wherep = reinterpret_cast<std::uintptr_t>(newnode) + 1;
  tree->count += 1;
  return 2;
}

int critbit_delete(critbit_tree* tree, const char* key) {
  auto* ukey = reinterpret_cast<const std::uint8_t*>(key);
  const std::size_t ulen = std::strlen(key);
  if (!tree->root) return 0;

  std::uintptr_t* wherep = &tree->root;
  std::uintptr_t* whereq = nullptr;
  critbit_internal_node* q = nullptr;
  int d = 0;
  while (isInternal(*wherep)) {
    whereq = wherep;
    q = internalOf(*wherep);
    d = direction(q, ukey, ulen);
    wherep = &q->child[d];
  }
  critbit_external_node* p = externalOf(*wherep);
  if (std::strcmp(key, reinterpret_cast<const char*>(keyOf(p))) != 0) return 0;

  if (tree->release) tree->release(p->value);
  std::free(p);
  tree->count -= 1;

  if (!whereq) {
    tree->root = 0;
    return 1;
  }
  *whereq = q->child[1 - d];
  std::free(q);
  return 1;
}

void traverse(critbit_tree* tree, std::uintptr_t node) {
  if (isInternal(node)) {
    critbit_internal_node* q = internalOf(node);
    traverse(tree, q->child[0]);
    traverse(tree, q->child[1]);
    std::free(q);
  } else {
    critbit_external_node* p = externalOf(node);
    if (tree->release) tree->release(p->value);
    std::free(p);
  }
}

void critbit_clear(critbit_tree* tree) {
  if (tree->root) traverse(tree, tree->root);
  tree->root = 0;
  tree->count = 0;
}

int allprefixed_traverse(std::uintptr_t node, critbit_callback callback, void* arg) {
  if (isInternal(node)) {
    critbit_internal_node* q = internalOf(node);
    for (int dir = 0; dir < 2; ++dir) {
      int r = allprefixed_traverse(q->child[dir], callback, arg);
      if (r == 1) continue;
      if (r == 0) return 0;
      return -1;
    }
    return 1;
  }
  return callback(reinterpret_cast<const char*>(keyOf(externalOf(node))), arg);
}

int critbit_allprefixed(critbit_tree* tree, const char* prefix, critbit_callback callback, void* arg) {
  if (!prefix) return 1;
  auto* ukey = reinterpret_cast<const std::uint8_t*>(prefix);
  const std::size_t ulen = std::strlen(prefix);
  if (!tree->root) return 1;

  std::uintptr_t p = tree->root;
  std::uintptr_t top = p;
  while (isInternal(p)) {
    critbit_internal_node* q = internalOf(p);
    p = q->child[direction(q, ukey, ulen)];
    if (q->byte < ulen) top = p;
  }
  const std::uint8_t* pkey = keyOf(externalOf(p));
  for (std::size_t i = 0; i < ulen; ++i) {
    if (pkey[i] != ukey[i]) return 1;
  }
  return allprefixed_traverse(top, callback, arg);
}

// CritbitTree

namespace {

void value_release(void* value) { static_cast<RefCounted*>(value)->release(); }

struct PrefixVisit {
  const CritbitTree::Visitor* visitor;
};

int prefix_callback(const char* key, void* arg) {
  auto* visit = static_cast<PrefixVisit*>(arg);
  bool stop = false;
  // The tree keeps ownership of the bytes: the view is valid only for this call.
  (*visit->visitor)(std::string_view(key, std::strlen(key)), &stop);
  return stop ? 0 : 1;
}

}  // namespace

CritbitTree::CritbitTree() { _tree.release = value_release; }

CritbitTree::~CritbitTree() { critbit_clear(&_tree); }

void CritbitTree::setObject(const Ref<RefCounted>& object, const std::string& key) {
  if (!object) return;
  int result = critbit_insert(&_tree, key.c_str(), object.get(), 1);
  // 0 means the tree already holds this object under the key (or could not store it): it must
  // not gain a second reference.
  if (result != 0) object->retain();
}

void CritbitTree::removeObjectForKey(const std::string& key) { critbit_delete(&_tree, key.c_str()); }

void CritbitTree::removeAllObjects() { critbit_clear(&_tree); }

Ref<RefCounted> CritbitTree::objectForKey(const std::string& key) {
  void* value = nullptr;
  if (!critbit_contains(&_tree, key.c_str(), &value)) return nullptr;
  return Ref<RefCounted>(static_cast<RefCounted*>(value));
}

void CritbitTree::keysMatchingPrefix(const std::string& prefix, const Visitor& visitor) {
  PrefixVisit visit{&visitor};
  critbit_allprefixed(&_tree, prefix.c_str(), prefix_callback, &visit);
}

}  // namespace tavix
