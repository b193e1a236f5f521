// PObject: the one dynamic value type of the library.
//
// A PObject is null, an unsigned 64-bit integer, a string, a map from string
// keys to PObjects, or an array of PObjects. It is exactly two words: a type
// code and a pointer to a heap-allocated holder of the value (null for a null
// object). Copies are deep. Reading a value as the wrong kind never fails:
// it yields 0, the empty string, or one of the shared empty instances. The
// only exception the type raises itself is std::out_of_range from the
// non-const numeric operator[].
//
// Thread-safety: none; one object is used by one thread at a time. The
// shared empty instances are created once and then only read.
#ifndef S2S_POBJECT_H_
#define S2S_POBJECT_H_

#include <stdint.h>

#include <map>
#include <string>
#include <vector>

#include "S2S/export.h"

namespace S2S {

class S2S_EXPORT PObject {
 public:
  typedef std::map<std::string, PObject> Map;
  typedef std::vector<PObject> Array;

  // Type codes. A null object has a null pointer; its code is not consulted.
  enum TypeCode : int32_t {
    kNull = 0,
    kArray = 1,
    kMap = 2,
    kInteger = 3,
    kString = 4,
  };

  PObject() : type_(kNull), value_(nullptr) {}
  PObject(const char* s);         // string
  PObject(const std::string& s);  // string
  PObject(unsigned long long v);  // integer
  PObject(const PObject& other);  // deep copy through copy()
  // Takes the value over without copying; `other` is left null. Lets
  // containers of PObject grow without deep copies.
  PObject(PObject&& other) noexcept : PObject() { swap(other); }
  ~PObject() { clear(); }

  // Every assignment replaces the whole value, whatever kind it had.
  PObject& operator=(const char* s);
  PObject& operator=(const std::string& s);
  // Takes the string's bytes over without copying them.
  PObject& operator=(std::string&& s);
  PObject& operator=(unsigned long long v);
  PObject& operator=(int v);           // sign-extended: -1 is 2^64-1
  PObject& operator=(unsigned int v);  // zero-extended
  PObject& operator=(bool v);          // 1 or 0
  PObject& operator=(const Map& m);    // deep copy
  PObject& operator=(const Array& a);  // deep copy
  // Deep copy through copy(): the target is cleared first, so `a = a`
  // leaves `a` null. That is the defined behaviour.
  PObject& operator=(const PObject& other);

  // Kind tests.
  bool isNull() const { return value_ == nullptr; }
  bool isArray() const { return type_ == kArray; }
  bool isMap() const { return type_ == kMap; }
  bool isInteger() const { return type_ == kInteger; }
  bool isString() const { return type_ == kString; }
  bool isContainer() const { return isArray() || isMap(); }
  bool isPrimitive() const { return isString() || isInteger(); }
  // True for null, an empty string and an empty container; an integer is
  // never empty, not even 0.
  bool isEmpty() const;
  // True only for a non-null map holding `key`.
  bool hasMember(const std::string& key) const;

  // Numeric views of an integer; 0 for any other kind. There is no
  // string-to-number conversion.
  unsigned long long asUInt64() const;
  unsigned long long asInteger() const { return asUInt64(); }
  long long asInt64() const { return static_cast<long long>(asUInt64()); }
  unsigned int asUInt32() const { return static_cast<uint32_t>(asUInt64()); }
  int asInt32() const { return static_cast<int32_t>(asUInt64()); }
  unsigned short asUInt16() const { return static_cast<uint16_t>(asUInt64()); }
  short asInt16() const { return static_cast<int16_t>(asUInt64()); }
  unsigned char asUInt8() const { return static_cast<uint8_t>(asUInt64()); }
  signed char asInt8() const { return static_cast<int8_t>(asUInt64()); }
  // Integer: value != 0. Any other kind: !isEmpty(), so "0" and "false" are
  // true.
  bool asBool() const;
  // A string: a copy. An integer: its low 32 bits as unsigned decimal (the
  // integer 4294967296 gives "0"). Anything else: "".
  std::string asString() const;
  // A string: the stored string itself, without a copy. Anything else: a
  // shared empty string. Valid until the object changes.
  const std::string& asStringRef() const;

  // The stored container, or the shared empty one for any other kind.
  const Map& asMap() const;
  const Array& asArray() const;
  // The stored container; any other value is first released and replaced by
  // an empty container of that kind.
  Map& asMap();
  Array& asArray();

  // Map member by key. Const: the member, or the shared null object.
  // Non-const: the member, inserted as null if absent; a value that is not a
  // map is first replaced by an empty map.
  const PObject& operator[](const std::string& key) const;
  PObject& operator[](const std::string& key);
  // Element by position. Const: on a map the i-th entry in key order, on an
  // array element i; the shared null object when out of range or for any
  // other kind. Non-const: serves maps only; it throws std::out_of_range
  // ("out_of_range: PObject::operator[]") when the walk lands on the end,
  // and for every array (even a valid index) and every other kind. Change an
  // array element through asArray() instead.
  const PObject& operator[](unsigned int i) const;
  PObject& operator[](unsigned int i);

  // Exchanges the two words of both objects; never allocates.
  void swap(PObject& other);
  // Releases the value (containers recursively); leaves the object null with
  // type code 0.
  void clear();
  // Clears the target, then deep-copies `src`.
  void copy(const PObject& src);
  // Allocates a copy of `value` first, then releases the old value, so a
  // value taken from this object itself is safe. T is one of unsigned long
  // long, std::string, Map and Array.
  template <typename T>
  void copy(const T& value);
  // Type code for T (Array 1, Map 2, unsigned long long 3, std::string 4).
  template <typename T>
  int32_t type_trait() const;

  // Renders the value for logs: null, 42, "raw string", [a, b],
  // {"key": value, ...}. Nothing is escaped; nothing parses it back.
  std::string toString() const;

  int32_t typeCode() const { return type_; }

  // The shared instances handed out when the asked-for thing does not exist.
  // Callers must not modify them.
  static const PObject& GetEmptyObject();
  static const Map& GetEmptyMap();
  static const Array& GetEmptyArray();

 private:
  template <typename T>
  T* as() const {
    return static_cast<T*>(value_);
  }
  // Deletes the holder of a leaf (integer or string) value; containers are
  // dismantled iteratively by clear().
  void releaseLeaf();

  int32_t type_;
  void* value_;
};

static_assert(sizeof(PObject) == 2 * sizeof(void*),
              "a PObject is a type code and a pointer");

template <>
inline int32_t PObject::type_trait<PObject::Array>() const {
  return kArray;
}
template <>
inline int32_t PObject::type_trait<PObject::Map>() const {
  return kMap;
}
template <>
inline int32_t PObject::type_trait<unsigned long long>() const {
  return kInteger;
}
template <>
inline int32_t PObject::type_trait<std::string>() const {
  return kString;
}

template <typename T>
void PObject::copy(const T& value) {
  T* holder = new T(value);
  clear();
  value_ = holder;
  type_ = type_trait<T>();
}

}  // namespace S2S

#endif  // S2S_POBJECT_H_
