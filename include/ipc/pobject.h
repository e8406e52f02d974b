// PObject: the dynamically typed value that every message to and from the
// copy daemon is made of. A request is a map with an "action" key and its
// arguments; the answer is another map.
//
// A value is one of seven kinds, identified by a fixed 32-bit tag that the
// wire serialiser relies on:
//   0 null, 1 array, 2 map (byte-wise key order), 3 unsigned 64-bit
//   integer, 4 string, 5 binary (a file section), 6 buffer (raw bytes).
// The object is two words: the tag and the payload word. An integer is
// kept in the payload word itself; every other kind has a heap payload that
// the object owns and the word points to (the null value has none). Every
// assignment releases the old payload; the destructor releases it too.
// Containers own their elements.
//
// Reading never fails: a missing member, an element out of range or a value
// of another kind yields null, 0, the empty string or one of the shared empty
// objects below. The only exception thrown is std::out_of_range from the
// non-const operator[](int).
//
// Threading: a PObject is used by one thread at a time. The shared empty
// objects are never modified, so any thread may read them.
#ifndef PLOVO_IPC_POBJECT_H
#define PLOVO_IPC_POBJECT_H

#include <cstdint>
#include <map>
#include <string>
#include <vector>

class PObject {
 public:
  using array_type = std::vector<PObject>;
  using map_type = std::map<std::string, PObject>;

  // A section of a local file, sent or received as a binary transfer.
  // Empty means "no file": offset and length are not looked at.
  struct binary_type {
    uint64_t offset = 0;
    uint64_t length = 0;
    std::string path;

    bool empty() const { return path.empty(); }
    void clear();
  };

  // A small raw byte buffer with 16-bit sizes. The block comes from the C
  // allocator (realloc/free) and is owned by the buffer; copies duplicate it.
  struct buffer_type {
    uint16_t length = 0;    // bytes in use
    uint16_t capacity = 0;  // bytes allocated
    char* data = nullptr;

    buffer_type() = default;
    buffer_type(const buffer_type& other);
    // Takes other's bytes; when the copy cannot be allocated the target is
    // left with no block, length 0 and capacity 0.
    buffer_type& operator=(const buffer_type& other);
    ~buffer_type();

    // Sizes the block for n bytes (see realloc_data), zeroes all of it and
    // copies n bytes from src, which must not point into this block.
    // Returns 0, or -1 when the block cannot be allocated (nothing changed).
    int assign(const void* src, uint16_t n);
    // Zeroes the block and sets length 0; the block is kept for reuse.
    void clear();
    bool empty() const { return length == 0; }
    // Keeps the block while n fits and uses at least half of it, so that a
    // buffer refilled with similar sizes is not reallocated each time;
    // otherwise reallocates to exactly n bytes (n == 0 frees the block).
    // length is cut to n when it no longer fits. Returns 0, or -1 when the
    // reallocation fails (nothing changed).
    int realloc_data(uint16_t n);
  };

  // The tag of payload type T, for code that is generic over the kinds.
  template <typename T>
  struct type_trait;

  // Shared read-only defaults handed out by the const accessors.
  static const PObject empty_object;
  static const array_type empty_array;
  static const map_type empty_map;
  static const binary_type empty_binary;
  static const buffer_type empty_buffer;

  // Constructors are implicit so that values can be written where a
  // PObject is expected (push_back("x"), a function argument).
  PObject() noexcept : type_(0), data_(nullptr) {}
  PObject(const char* s);
  PObject(const std::string& s);
  PObject(uint64_t n) noexcept;
  PObject(const buffer_type& b);
  PObject(const PObject& other);
  // Takes other's payload; other is left null. Cheap, so containers of
  // PObject move their elements instead of copying them.
  PObject(PObject&& other) noexcept;
  ~PObject() { clear(); }

  // Each assignment replaces the whole value. Integer assignments all give
  // the integer kind: int and long are sign-extended to 64 bits, the
  // unsigned types and bool zero-extended (true is 1).
  //
  // Assigning a value to itself (copy or move) leaves it null: the old
  // payload counts as released before the source is read. Callers never do
  // it. Assigning a value's own member or element to it is safe.
  PObject& operator=(const PObject& other);
  PObject& operator=(PObject&& other) noexcept;
  PObject& operator=(const std::string& s);
  // Takes the text without copying it.
  PObject& operator=(std::string&& s);
  PObject& operator=(const char* s);
  PObject& operator=(const buffer_type& b);
  PObject& operator=(const binary_type& b);
  PObject& operator=(const array_type& a);
  PObject& operator=(const map_type& m);
  PObject& operator=(int n);
  PObject& operator=(unsigned int n);
  PObject& operator=(bool b);
  PObject& operator=(long n);
  PObject& operator=(unsigned long n);

  // Deep copy by kind: containers element by element, recursively.
  // Copying a value onto itself leaves it null.
  void copy(const PObject& other);
  // Exchanges the two values without copying.
  void swap(PObject& other) noexcept;
  // Releases the payload; the value becomes null.
  void clear() noexcept;

  // Kind tests. A value is null exactly when it holds no payload.
  bool isNull() const { return type_ == 0; }
  bool isArray() const { return type_ == 1; }
  bool isMap() const { return type_ == 2; }
  bool isInteger() const { return type_ == 3; }
  bool isString() const { return type_ == 4; }
  bool isBinary() const { return type_ == 5; }
  bool isBuffer() const { return type_ == 6; }
  bool isContainer() const { return isArray() || isMap(); }
  bool isPrimitive() const { return isString() || isInteger() || isBinary() || isBuffer(); }
  // Null is empty, an integer never; a string, array or map without
  // contents, a binary without path and a buffer with length 0 are empty.
  bool isEmpty() const;
  // True only for a map holding key (exact byte comparison).
  bool hasMember(const std::string& key) const;

  // The stored integer (0 for other kinds); the narrower readers truncate
  // it to their width without range or sign checks.
  uint64_t asUInt64() const;
  int64_t asInteger() const { return static_cast<int64_t>(asUInt64()); }
  int64_t asInt64() const { return static_cast<int64_t>(asUInt64()); }
  uint32_t asUInt32() const { return static_cast<uint32_t>(asUInt64()); }
  int32_t asInt32() const { return static_cast<int32_t>(asUInt64()); }
  uint16_t asUInt16() const { return static_cast<uint16_t>(asUInt64()); }
  int16_t asInt16() const { return static_cast<int16_t>(asUInt64()); }
  uint8_t asUInt8() const { return static_cast<uint8_t>(asUInt64()); }
  int8_t asInt8() const { return static_cast<int8_t>(asUInt64()); }
  // An integer is true when not 0; any other value when it is not empty.
  bool asBool() const;
  // A string's text; an integer's low 32 bits in decimal; otherwise "".
  // Values of 2^32 and more print truncated on purpose: do not widen it.
  std::string asString() const;
  // A string's text without a copy; the empty string for other kinds.
  const std::string& asStringRef() const;

  // The payload, or the matching shared empty object for another kind.
  const map_type& asMap() const;
  const array_type& asArray() const;
  const binary_type& asBinary() const;
  const buffer_type& asBuffer() const;
  // The payload for modification; a value of another kind is first
  // replaced by an empty one of this kind.
  map_type& asMap();
  array_type& asArray();
  binary_type& asBinary();
  buffer_type& asBuffer();

  // The member under key of a map, else empty_object.
  const PObject& operator[](const std::string& key) const;
  // Element n of an array, or the value of a map's n-th entry in key
  // order; empty_object when n is negative, past the end, or the value is
  // of another kind.
  const PObject& operator[](int n) const;
  // Turns a non-map value into an empty map, then returns the member under
  // key, inserting a null member when it is absent.
  PObject& operator[](const std::string& key);
  // The value of a map's n-th entry in key order. Throws std::out_of_range
  // ("out_of_range: PObject::operator[]") for any other kind, arrays
  // included, and when n is negative or past the end.
  PObject& operator[](int n);

  // The text form used when requests and answers are logged, e.g.
  // {"action": "list_task", "task_id": 3}. Nothing is escaped.
  std::string toString() const;

 private:
  void toString(std::string& out) const;
  // Puts a payload of type T in place of the current one. The payload is
  // built before the old one is released, so the source may live inside
  // this value.
  template <typename T>
  PObject& reset(T&& value);
  PObject& setInteger(uint64_t n) noexcept;
  const PObject* nthMapEntry(int n) const;

  uint32_t type_;
  union {
    void* data_;        // the heap payload of every kind but the integer
    uint64_t number_;   // the integer itself
  };
};

// The tags are the wire format's; they must never change.
template <uint32_t Tag>
struct PObjectTypeTag {
  static constexpr uint32_t value = Tag;
};
template <> struct PObject::type_trait<PObject::array_type> : PObjectTypeTag<1> {};
template <> struct PObject::type_trait<PObject::map_type> : PObjectTypeTag<2> {};
template <> struct PObject::type_trait<uint64_t> : PObjectTypeTag<3> {};
template <> struct PObject::type_trait<std::string> : PObjectTypeTag<4> {};
template <> struct PObject::type_trait<PObject::binary_type> : PObjectTypeTag<5> {};
template <> struct PObject::type_trait<PObject::buffer_type> : PObjectTypeTag<6> {};

#endif
