#include "S2S/pobject.h"

#include <stdio.h>

#include <sstream>
#include <stdexcept>
#include <utility>

namespace S2S {

namespace {

const char kOutOfRange[] = "out_of_range: PObject::operator[]";

// Moves every member of a container out into `pending`, leaving null values
// behind so that deleting the container recurses no further.
void DetachChildren(PObject::Map& m, std::vector<PObject>& pending) {
  for (auto& entry : m) {
    pending.emplace_back();
    pending.back().swap(entry.second);
  }
}
void DetachChildren(PObject::Array& a, std::vector<PObject>& pending) {
  for (auto& element : a) {
    pending.emplace_back();
    pending.back().swap(element);
  }
}

void Render(const PObject& v, std::ostringstream& out) {
  if (v.isNull()) {
    out << "null";
  } else if (v.isInteger()) {
    out << v.asUInt64();
  } else if (v.isString()) {
    out << '"' << v.asString() << '"';
  } else if (v.isArray()) {
    out << '[';
    bool first = true;
    for (const PObject& e : v.asArray()) {
      if (!first) out << ", ";
      first = false;
      Render(e, out);
    }
    out << ']';
  } else if (v.isMap()) {
    out << '{';
    bool first = true;
    for (const auto& entry : v.asMap()) {
      out << (first ? "\"" : ", \"") << entry.first << "\": ";
      first = false;
      Render(entry.second, out);
    }
    out << '}';
  }
}

}  // namespace

PObject::PObject(const char* s) : PObject() { copy(std::string(s)); }
PObject::PObject(const std::string& s) : PObject() { copy(s); }
PObject::PObject(unsigned long long v) : PObject() { copy(v); }
PObject::PObject(const PObject& other) : PObject() { copy(other); }

PObject& PObject::operator=(const char* s) {
  copy(std::string(s));
  return *this;
}
PObject& PObject::operator=(const std::string& s) {
  copy(s);
  return *this;
}
PObject& PObject::operator=(std::string&& s) {
  std::string* holder = new std::string(std::move(s));
  clear();
  value_ = holder;
  type_ = kString;
  return *this;
}
PObject& PObject::operator=(unsigned long long v) {
  copy(v);
  return *this;
}
PObject& PObject::operator=(int v) {
  copy(static_cast<unsigned long long>(static_cast<long long>(v)));
  return *this;
}
PObject& PObject::operator=(unsigned int v) {
  copy(static_cast<unsigned long long>(v));
  return *this;
}
PObject& PObject::operator=(bool v) {
  copy(static_cast<unsigned long long>(v ? 1 : 0));
  return *this;
}
PObject& PObject::operator=(const Map& m) {
  copy(m);
  return *this;
}
PObject& PObject::operator=(const Array& a) {
  copy(a);
  return *this;
}
PObject& PObject::operator=(const PObject& other) {
  copy(other);
  return *this;
}

bool PObject::isEmpty() const {
  if (isNull()) return true;
  switch (type_) {
    case kInteger:
      return false;
    case kString:
      return as<std::string>()->empty();
    case kMap:
      return as<Map>()->empty();
    case kArray:
      return as<Array>()->empty();
    default:
      return true;
  }
}

bool PObject::hasMember(const std::string& key) const {
  return !isNull() && isMap() && as<Map>()->count(key) != 0;
}

unsigned long long PObject::asUInt64() const {
  return (!isNull() && isInteger()) ? *as<unsigned long long>() : 0;
}

bool PObject::asBool() const {
  if (!isNull() && isInteger()) return *as<unsigned long long>() != 0;
  return !isEmpty();
}

const std::string& PObject::asStringRef() const {
  static const std::string* const empty = new std::string();
  return !isNull() && isString() ? *as<std::string>() : *empty;
}

std::string PObject::asString() const {
  if (isNull()) return std::string();
  if (isString()) return *as<std::string>();
  if (isInteger()) {
    // Only the low 32 bits are printed; hosts rely on this rendering.
    char buf[64];
    snprintf(buf, sizeof buf, "%u",
             static_cast<unsigned int>(*as<unsigned long long>()));
    return buf;
  }
  return std::string();
}

const PObject::Map& PObject::asMap() const {
  return (!isNull() && isMap()) ? *as<Map>() : GetEmptyMap();
}
const PObject::Array& PObject::asArray() const {
  return (!isNull() && isArray()) ? *as<Array>() : GetEmptyArray();
}

PObject::Map& PObject::asMap() {
  if (isNull() || !isMap()) copy(Map());
  return *as<Map>();
}
PObject::Array& PObject::asArray() {
  if (isNull() || !isArray()) copy(Array());
  return *as<Array>();
}

const PObject& PObject::operator[](const std::string& key) const {
  if (isNull() || !isMap()) return GetEmptyObject();
  const Map& m = *as<Map>();
  auto it = m.find(key);
  return it == m.end() ? GetEmptyObject() : it->second;
}

PObject& PObject::operator[](const std::string& key) { return asMap()[key]; }

const PObject& PObject::operator[](unsigned int i) const {
  if (isNull()) return GetEmptyObject();
  if (isArray()) {
    const Array& a = *as<Array>();
    return i < a.size() ? a[i] : GetEmptyObject();
  }
  if (isMap()) {
    // Every index at or past the size lands on the end.
    const Map& m = *as<Map>();
    if (i >= m.size()) return GetEmptyObject();
    auto it = m.begin();
    std::advance(it, i);
    return it->second;
  }
  return GetEmptyObject();
}

PObject& PObject::operator[](unsigned int i) {
  // Deliberately maps only: a mutable array is changed through asArray().
  if (isNull() || !isMap()) throw std::out_of_range(kOutOfRange);
  Map& m = *as<Map>();
  if (i >= m.size()) throw std::out_of_range(kOutOfRange);
  auto it = m.begin();
  std::advance(it, i);
  return it->second;
}

void PObject::swap(PObject& other) {
  std::swap(type_, other.type_);
  std::swap(value_, other.value_);
}

void PObject::releaseLeaf() {
  if (type_ == kString) {
    delete as<std::string>();
  } else if (type_ == kInteger) {
    delete as<unsigned long long>();
  }
  type_ = kNull;
  value_ = nullptr;
}

void PObject::clear() {
  if (isNull()) {
    type_ = kNull;
    return;
  }
  if (!isContainer()) {
    releaseLeaf();
    return;
  }
  // Containers are dismantled with an explicit work list rather than by
  // recursion, so that a value nested many thousands of levels deep is
  // released without exhausting the stack.
  std::vector<PObject> pending;
  PObject item;
  item.swap(*this);
  for (;;) {
    if (item.isMap()) {
      DetachChildren(*item.as<Map>(), pending);
      delete item.as<Map>();
    } else if (item.isArray()) {
      DetachChildren(*item.as<Array>(), pending);
      delete item.as<Array>();
    } else {
      item.releaseLeaf();
    }
    item.type_ = kNull;
    item.value_ = nullptr;
    if (pending.empty()) break;
    item.swap(pending.back());
    pending.pop_back();
  }
}

void PObject::copy(const PObject& src) {
  clear();
  // Iterative deep copy: each work item is a source value and the null
  // target that receives it. Targets are map nodes or elements of vectors
  // that are not resized again, so their addresses stay valid.
  std::vector<std::pair<const PObject*, PObject*>> work;
  work.emplace_back(&src, this);
  while (!work.empty()) {
    const PObject* from = work.back().first;
    PObject* to = work.back().second;
    work.pop_back();
    if (from->isNull()) continue;
    switch (from->type_) {
      case kInteger:
        to->copy(*from->as<unsigned long long>());
        break;
      case kString:
        to->copy(from->asString());
        break;
      case kMap: {
        Map& out = to->asMap();
        for (const auto& entry : *from->as<Map>()) {
          PObject& slot =
              out.emplace_hint(out.end(), entry.first, PObject())->second;
          work.emplace_back(&entry.second, &slot);
        }
        break;
      }
      case kArray: {
        const Array& in = *from->as<Array>();
        Array& out = to->asArray();
        out.resize(in.size());
        for (size_t i = 0; i < in.size(); ++i) {
          work.emplace_back(&in[i], &out[i]);
        }
        break;
      }
      default:
        break;
    }
  }
}

std::string PObject::toString() const {
  std::ostringstream out;
  Render(*this, out);
  return out.str();
}

const PObject& PObject::GetEmptyObject() {
  static const PObject empty;
  return empty;
}
const PObject::Map& PObject::GetEmptyMap() {
  static const Map empty;
  return empty;
}
const PObject::Array& PObject::GetEmptyArray() {
  static const Array empty;
  return empty;
}

}  // namespace S2S
