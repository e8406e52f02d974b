#include "ipc/pobject.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <iterator>
#include <stdexcept>
#include <type_traits>
#include <utility>

static_assert(sizeof(PObject) == 2 * sizeof(void*), "a PObject is a tag and one word of payload");

const PObject PObject::empty_object;
const PObject::array_type PObject::empty_array;
const PObject::map_type PObject::empty_map;
const PObject::binary_type PObject::empty_binary;
const PObject::buffer_type PObject::empty_buffer;

namespace {

constexpr uint32_t kNull = 0;
constexpr uint32_t kArray = PObject::type_trait<PObject::array_type>::value;
constexpr uint32_t kMap = PObject::type_trait<PObject::map_type>::value;
constexpr uint32_t kInteger = PObject::type_trait<uint64_t>::value;
constexpr uint32_t kString = PObject::type_trait<std::string>::value;
constexpr uint32_t kBinary = PObject::type_trait<PObject::binary_type>::value;
constexpr uint32_t kBuffer = PObject::type_trait<PObject::buffer_type>::value;

}  // namespace

// ---- binary_type -----------------------------------------------------------

void PObject::binary_type::clear() {
  offset = 0;
  length = 0;
  path.clear();
}

// ---- buffer_type -----------------------------------------------------------

PObject::buffer_type::buffer_type(const buffer_type& other) {
  *this = other;
}

PObject::buffer_type& PObject::buffer_type::operator=(const buffer_type& other) {
  if (this == &other) return *this;  // assign() would zero the bytes it is about to copy
  if (assign(other.data, other.length) != 0) {
    free(data);
    data = nullptr;
    length = 0;
    capacity = 0;
  }
  return *this;
}

PObject::buffer_type::~buffer_type() {
  free(data);
}

int PObject::buffer_type::realloc_data(uint16_t n) {
  if (capacity >= n && n >= capacity / 2) return 0;
  if (n == 0) {
    // realloc(p, 0) may free p and still return null, which would read as
    // a failure with a dangling block; free it explicitly instead.
    free(data);
    data = nullptr;
  } else {
    char* block = static_cast<char*>(realloc(data, n));
    if (block == nullptr) return -1;
    data = block;
  }
  capacity = n;
  if (length > n) length = n;
  return 0;
}

int PObject::buffer_type::assign(const void* src, uint16_t n) {
  if (realloc_data(n) != 0) return -1;
  // A kept block may hold old bytes past n; zero it so no stale data stays.
  clear();
  if (n > 0) memcpy(data, src, n);
  length = n;
  return 0;
}

void PObject::buffer_type::clear() {
  if (data == nullptr) return;
  memset(data, 0, capacity);
  length = 0;
}

// ---- construction and assignment --------------------------------------------

PObject::PObject(const char* s) : PObject() { reset(std::string(s)); }
PObject::PObject(const std::string& s) : PObject() { reset(s); }
PObject::PObject(uint64_t n) noexcept : PObject() { setInteger(n); }
PObject::PObject(const buffer_type& b) : PObject() { reset(b); }
PObject::PObject(const PObject& other) : PObject() { copy(other); }

PObject::PObject(PObject&& other) noexcept : type_(other.type_), number_(other.number_) {
  other.type_ = kNull;
  other.data_ = nullptr;
}

template <typename T>
PObject& PObject::reset(T&& value) {
  using V = std::decay_t<T>;
  V* payload = new V(std::forward<T>(value));
  clear();
  type_ = type_trait<V>::value;
  data_ = payload;
  return *this;
}

PObject& PObject::setInteger(uint64_t n) noexcept {
  clear();
  type_ = kInteger;
  number_ = n;
  return *this;
}

PObject& PObject::operator=(const PObject& other) {
  copy(other);
  return *this;
}

PObject& PObject::operator=(PObject&& other) noexcept {
  if (this == &other) {
    clear();  // same outcome as a copy onto itself
    return *this;
  }
  // Taking the payload before releasing ours keeps this safe when other
  // is one of our own members.
  PObject taken(std::move(other));
  swap(taken);
  return *this;
}

PObject& PObject::operator=(const std::string& s) { return reset(s); }
PObject& PObject::operator=(std::string&& s) { return reset(std::move(s)); }
PObject& PObject::operator=(const char* s) { return reset(std::string(s)); }
PObject& PObject::operator=(const buffer_type& b) { return reset(b); }
PObject& PObject::operator=(const binary_type& b) { return reset(b); }
PObject& PObject::operator=(const array_type& a) { return reset(a); }
PObject& PObject::operator=(const map_type& m) { return reset(m); }
PObject& PObject::operator=(int n) { return setInteger(static_cast<uint64_t>(static_cast<int64_t>(n))); }
PObject& PObject::operator=(unsigned int n) { return setInteger(n); }
PObject& PObject::operator=(bool b) { return setInteger(b ? 1 : 0); }
PObject& PObject::operator=(long n) { return setInteger(static_cast<uint64_t>(static_cast<int64_t>(n))); }
PObject& PObject::operator=(unsigned long n) { return setInteger(n); }

void PObject::copy(const PObject& other) {
  if (this == &other) {
    clear();
    return;
  }
  // Build the copy first: other may be an element of this value, which
  // releasing our payload would destroy.
  PObject result;
  switch (other.type_) {
    case kArray: result.reset(*static_cast<const array_type*>(other.data_)); break;
    case kMap: result.reset(*static_cast<const map_type*>(other.data_)); break;
    case kInteger: result.setInteger(other.number_); break;
    case kString: result.reset(*static_cast<const std::string*>(other.data_)); break;
    case kBinary: result.reset(*static_cast<const binary_type*>(other.data_)); break;
    case kBuffer: result.reset(*static_cast<const buffer_type*>(other.data_)); break;
    default: break;
  }
  swap(result);
}

void PObject::swap(PObject& other) noexcept {
  std::swap(type_, other.type_);
  std::swap(number_, other.number_);
}

void PObject::clear() noexcept {
  switch (type_) {
    case kArray: delete static_cast<array_type*>(data_); break;
    case kMap: delete static_cast<map_type*>(data_); break;
    case kString: delete static_cast<std::string*>(data_); break;
    case kBinary: delete static_cast<binary_type*>(data_); break;
    case kBuffer: delete static_cast<buffer_type*>(data_); break;
    default: break;
  }
  type_ = kNull;
  data_ = nullptr;
}

// ---- tests and readers -----------------------------------------------------

bool PObject::isEmpty() const {
  switch (type_) {
    case kArray: return asArray().empty();
    case kMap: return asMap().empty();
    case kInteger: return false;
    case kString: return static_cast<const std::string*>(data_)->empty();
    case kBinary: return asBinary().empty();
    case kBuffer: return asBuffer().empty();
    default: return true;
  }
}

bool PObject::hasMember(const std::string& key) const {
  return isMap() && asMap().count(key) != 0;
}

uint64_t PObject::asUInt64() const {
  return isInteger() ? number_ : 0;
}

bool PObject::asBool() const {
  return isInteger() ? asUInt64() != 0 : !isEmpty();
}

const std::string& PObject::asStringRef() const {
  static const std::string empty;
  return isString() ? *static_cast<const std::string*>(data_) : empty;
}

std::string PObject::asString() const {
  if (isString()) return *static_cast<const std::string*>(data_);
  if (isInteger()) {
    char text[16];
    snprintf(text, sizeof(text), "%u", static_cast<unsigned>(asUInt32()));
    return text;
  }
  return std::string();
}

const PObject::map_type& PObject::asMap() const {
  return isMap() ? *static_cast<const map_type*>(data_) : empty_map;
}

const PObject::array_type& PObject::asArray() const {
  return isArray() ? *static_cast<const array_type*>(data_) : empty_array;
}

const PObject::binary_type& PObject::asBinary() const {
  return isBinary() ? *static_cast<const binary_type*>(data_) : empty_binary;
}

const PObject::buffer_type& PObject::asBuffer() const {
  return isBuffer() ? *static_cast<const buffer_type*>(data_) : empty_buffer;
}

PObject::map_type& PObject::asMap() {
  if (!isMap()) reset(empty_map);
  return *static_cast<map_type*>(data_);
}

PObject::array_type& PObject::asArray() {
  if (!isArray()) reset(empty_array);
  return *static_cast<array_type*>(data_);
}

PObject::binary_type& PObject::asBinary() {
  if (!isBinary()) reset(empty_binary);
  return *static_cast<binary_type*>(data_);
}

PObject::buffer_type& PObject::asBuffer() {
  if (!isBuffer()) reset(empty_buffer);
  return *static_cast<buffer_type*>(data_);
}

// ---- subscripts ------------------------------------------------------------

const PObject* PObject::nthMapEntry(int n) const {
  const map_type& map = asMap();
  // There is nothing before the first entry; stepping back from it would
  // leave the map.
  if (n < 0 || static_cast<size_t>(n) >= map.size()) return nullptr;
  return &std::next(map.begin(), n)->second;
}

const PObject& PObject::operator[](const std::string& key) const {
  if (!isMap()) return empty_object;
  const map_type& map = asMap();
  auto it = map.find(key);
  return it == map.end() ? empty_object : it->second;
}

const PObject& PObject::operator[](int n) const {
  if (isArray()) {
    const array_type& array = asArray();
    return n >= 0 && static_cast<size_t>(n) < array.size() ? array[n] : empty_object;
  }
  const PObject* entry = nthMapEntry(n);
  return entry != nullptr ? *entry : empty_object;
}

PObject& PObject::operator[](const std::string& key) {
  return asMap()[key];
}

PObject& PObject::operator[](int n) {
  const PObject* entry = isMap() ? nthMapEntry(n) : nullptr;
  if (entry == nullptr) throw std::out_of_range("out_of_range: PObject::operator[]");
  return const_cast<PObject&>(*entry);
}

// ---- text form ---------------------------------------------------------------

std::string PObject::toString() const {
  std::string out;
  toString(out);
  return out;
}

void PObject::toString(std::string& out) const {
  switch (type_) {
    case kInteger: out += std::to_string(asUInt64()); break;
    case kString:
      out += '"';
      out += *static_cast<const std::string*>(data_);
      out += '"';
      break;
    case kBinary: {
      const binary_type& b = asBinary();
      out += "{offset: " + std::to_string(b.offset) + ", length: " + std::to_string(b.length) +
             ", path: \"" + b.path + "\"}";
      break;
    }
    case kBuffer: out += "{data_length: " + std::to_string(asBuffer().length) + ", }"; break;
    case kArray: {
      out += '[';
      const char* separator = "";
      for (const PObject& element : asArray()) {
        out += separator;
        element.toString(out);
        separator = ", ";
      }
      out += ']';
      break;
    }
    case kMap: {
      out += '{';
      const char* separator = "";
      for (const auto& [key, value] : asMap()) {
        out += separator;
        out += '"';
        out += key;
        out += "\": ";
        value.toString(out);
        separator = ", ";
      }
      out += '}';
      break;
    }
    default: out += "null"; break;
  }
}
