#include "filter/vt-string.h"

#include <cstdlib>
#include <cstring>

namespace {

// A copy of length bytes followed by a NUL; nullptr when memory runs out.
char* Duplicate(const char* data, size_t length, bool fold) {
  char* copy = static_cast<char*>(malloc(length + 1));
  if (copy == nullptr) return nullptr;
  for (size_t i = 0; i < length; ++i) {
    copy[i] = fold ? static_cast<char>(vt_fold(static_cast<unsigned char>(data[i]))) : data[i];
  }
  copy[length] = '\0';
  return copy;
}

// Puts member index into the table unless an equal folded member is there.
void AddSlot(vt_string_set* set, size_t index) {
  const vt_string& key = set->folded[index];
  const size_t mask = set->slot_count - 1;
  for (size_t i = vt_string_hash(key.data, key.length) & mask;; i = (i + 1) & mask) {
    if (set->slots[i] == 0) {
      set->slots[i] = static_cast<uint32_t>(index + 1);
      return;
    }
    const vt_string& other = set->folded[set->slots[i] - 1];
    if (other.length == key.length && memcmp(other.data, key.data, key.length) == 0) return;
  }
}

// Rebuilds the table for room of at least twice the members.
int Rehash(vt_string_set* set, size_t members) {
  size_t slotCount = 8;
  while (slotCount < 2 * members) slotCount *= 2;
  auto* slots = static_cast<uint32_t*>(calloc(slotCount, sizeof(uint32_t)));
  if (slots == nullptr) return -1;
  free(set->slots);
  set->slots = slots;
  set->slot_count = slotCount;
  for (size_t i = 0; i < set->count; ++i) AddSlot(set, i);
  return 0;
}

}  // namespace

void vt_string_init(vt_string* s) {
  s->data = nullptr;
  s->length = 0;
}

int vt_string_assign(vt_string* s, const char* data, size_t length) {
  char* copy = nullptr;
  if (length > 0 && (copy = Duplicate(data, length, false)) == nullptr) return -1;
  free(s->data);
  s->data = copy;
  s->length = length;
  return 0;
}

int vt_string_copy(vt_string* dst, const vt_string* src) {
  if (dst == src) return 0;
  return vt_string_assign(dst, src->data, src->length);
}

void vt_string_destroy(vt_string* s) {
  free(s->data);
  vt_string_init(s);
}

void vt_string_set_init(vt_string_set* set) { *set = vt_string_set{}; }

int vt_string_set_insert(vt_string_set* set, const char* data, size_t length) {
  if (set->count == UINT32_MAX - 1) return -1;  // the table holds 32-bit indices
  if (set->count == set->capacity) {
    const size_t capacity = set->capacity == 0 ? 4 : 2 * set->capacity;
    auto* items = static_cast<vt_string*>(realloc(set->items, capacity * sizeof(vt_string)));
    if (items == nullptr) return -1;
    set->items = items;
    auto* folded = static_cast<vt_string*>(realloc(set->folded, capacity * sizeof(vt_string)));
    if (folded == nullptr) return -1;
    set->folded = folded;
    set->capacity = capacity;
  }
  if (2 * (set->count + 1) > set->slot_count && Rehash(set, set->count + 1) != 0) return -1;
  char* copy = Duplicate(data, length, false);
  char* folded = Duplicate(data, length, true);
  if (copy == nullptr || folded == nullptr) {
    free(copy);
    free(folded);
    return -1;
  }
  set->items[set->count] = vt_string{copy, length};
  set->folded[set->count] = vt_string{folded, length};
  AddSlot(set, set->count);
  ++set->count;
  return 0;
}

int vt_string_set_remove(vt_string_set* set, const char* data, size_t length) {
  for (size_t i = 0; i < set->count; ++i) {
    if (set->items[i].length != length || memcmp(set->items[i].data, data, length) != 0) continue;
    free(set->items[i].data);
    free(set->folded[i].data);
    memmove(set->items + i, set->items + i + 1, (set->count - i - 1) * sizeof(vt_string));
    memmove(set->folded + i, set->folded + i + 1, (set->count - i - 1) * sizeof(vt_string));
    --set->count;
    // The table's indices moved: start it afresh in place.
    memset(set->slots, 0, set->slot_count * sizeof(uint32_t));
    for (size_t j = 0; j < set->count; ++j) AddSlot(set, j);
    return 0;
  }
  return -1;
}

int vt_string_set_copy(vt_string_set* dst, const vt_string_set* src) {
  if (dst == src) return 0;
  vt_string_set copy;
  vt_string_set_init(&copy);
  for (size_t i = 0; i < src->count; ++i) {
    if (vt_string_set_insert(&copy, src->items[i].data, src->items[i].length) != 0) {
      vt_string_set_destroy(&copy);
      return -1;
    }
  }
  vt_string_set_destroy(dst);
  *dst = copy;
  return 0;
}

void vt_string_set_destroy(vt_string_set* set) {
  for (size_t i = 0; i < set->count; ++i) {
    free(set->items[i].data);
    free(set->folded[i].data);
  }
  free(set->items);
  free(set->folded);
  free(set->slots);
  vt_string_set_init(set);
}

uint64_t vt_string_hash(const char* folded, size_t length) {
  uint64_t hash = 14695981039346656037ull;  // FNV-1a
  for (size_t i = 0; i < length; ++i) {
    hash = (hash ^ static_cast<unsigned char>(folded[i])) * 1099511628211ull;
  }
  return hash;
}

bool vt_string_set_has_folded(const vt_string_set* set, const char* folded, size_t length, uint64_t hash) {
  if (set->count == 0) return false;
  const size_t mask = set->slot_count - 1;
  for (size_t i = hash & mask; set->slots[i] != 0; i = (i + 1) & mask) {
    const vt_string& member = set->folded[set->slots[i] - 1];
    if (member.length == length && memcmp(member.data, folded, length) == 0) return true;
  }
  return false;
}
