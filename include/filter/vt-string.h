// The filter library's strings: vt_string, one string of bytes, and
// vt_string_set, an ordered list of them (members stay in insertion order,
// duplicates included).
//
// Plain C-style records filled in place: init before first use, destroy to
// free. Strings carry their length and may hold any byte, NUL included; the
// data is always followed by a NUL so that it can be read as a C string when
// it holds none. Functions that allocate return 0, or -1 when memory runs
// out, leaving the target as it was. Not thread-safe: one record, one
// thread at a time (reading from several threads at once is fine).
#ifndef PLOVO_FILTER_VT_STRING_H
#define PLOVO_FILTER_VT_STRING_H

#include <cstddef>
#include <cstdint>

struct vt_string {
  char* data;     // nullptr when empty
  size_t length;  // bytes, without the trailing NUL
};

// Besides the members in order, a set keeps each member folded to lower case
// and a hash table over the folded members, so that the matcher compares
// without regard to case without folding the members on every test.
struct vt_string_set {
  vt_string* items;   // the members, in order
  size_t count;
  size_t capacity;
  vt_string* folded;  // items[i] in ASCII lower case
  uint32_t* slots;    // open addressing: 1 + index of a folded member, 0 free
  size_t slot_count;  // a power of two, or 0
};

void vt_string_init(vt_string* s);
// Replaces the content with length bytes of data (an empty string frees it).
int vt_string_assign(vt_string* s, const char* data, size_t length);
int vt_string_copy(vt_string* dst, const vt_string* src);
void vt_string_destroy(vt_string* s);

void vt_string_set_init(vt_string_set* set);
// Appends a member at the end.
int vt_string_set_insert(vt_string_set* set, const char* data, size_t length);
// Removes the first member equal to data (case counts): 0, or -1 when there
// is none or memory runs out.
int vt_string_set_remove(vt_string_set* set, const char* data, size_t length);
// Makes dst a copy of src (dst must have been initialised).
int vt_string_set_copy(vt_string_set* dst, const vt_string_set* src);
void vt_string_set_destroy(vt_string_set* set);

// ASCII lower case of one byte; other bytes are left as they are.
inline unsigned char vt_fold(unsigned char c) { return (c >= 'A' && c <= 'Z') ? c + ('a' - 'A') : c; }
// Hash of already folded bytes, as the set's table uses it.
uint64_t vt_string_hash(const char* folded, size_t length);
// Whether a member equals the folded bytes without regard to case; hash is
// vt_string_hash(folded, length).
bool vt_string_set_has_folded(const vt_string_set* set, const char* folded, size_t length, uint64_t hash);

#endif
