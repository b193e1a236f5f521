#include "service/wire_reader.h"

#include <string.h>

#include <string>

namespace s2s_service {

namespace {

using S2S::PObject;

const unsigned char kNull = 0x00, kInteger = 0x01, kString = 0x10, kEnd = 0x40,
                    kArray = 0x41, kMap = 0x42;

class Reader {
 public:
  Reader(const char* data, size_t size, unsigned int max_depth)
      : p_(reinterpret_cast<const unsigned char*>(data)),
        size_(size),
        max_depth_(max_depth) {}

  // 1, 0 (more bytes needed) or -1, as DecodeMessage.
  int Element(PObject& out, unsigned int depth) {
    if (pos_ >= size_) return 0;
    unsigned char tag = p_[pos_++];
    if (tag == kString) return String(out);
    if (tag == kInteger) {
      if (pos_ >= size_) return 0;
      unsigned int width = p_[pos_++];
      if (width > 8) return -1;
      if (size_ - pos_ < width) return 0;
      unsigned long long v = 0;
      for (unsigned int i = 0; i < width; ++i) v = (v << 8) | p_[pos_++];
      out = v;
      return 1;
    }
    if (tag == kNull) {
      if (pos_ >= size_) return 0;
      return p_[pos_++] == 0 ? 1 : -1;
    }
    if (tag != kArray && tag != kMap) return -1;
    if (depth + 1 > max_depth_) return -1;
    if (tag == kArray) {
      PObject::Array a;
      for (;;) {
        if (pos_ >= size_) return 0;
        if (p_[pos_] == kEnd) break;
        a.emplace_back();
        int rc = Element(a.back(), depth + 1);
        if (rc != 1) return rc;
      }
      ++pos_;
      out = PObject();
      out = a;
      return 1;
    }
    PObject::Map m;
    for (;;) {
      if (pos_ >= size_) return 0;
      if (p_[pos_] == kEnd) break;
      if (p_[pos_++] != kString) return -1;
      PObject key;
      int rc = String(key);
      if (rc != 1) return rc;
      rc = Element(m[key.asStringRef()], depth + 1);
      if (rc != 1) return rc;
    }
    ++pos_;
    out = m;
    return 1;
  }

  size_t pos() const { return pos_; }

 private:
  int String(PObject& out) {
    if (size_ - pos_ < 2) return 0;
    size_t len = (static_cast<size_t>(p_[pos_]) << 8) | p_[pos_ + 1];
    pos_ += 2;
    if (size_ - pos_ < len) return 0;
    const char* s = reinterpret_cast<const char*>(p_ + pos_);
    // A string ends at its first zero byte, as the stream's reader cuts it.
    out = std::string(s, strnlen(s, len));
    pos_ += len;
    return 1;
  }

  const unsigned char* p_;
  size_t size_;
  size_t pos_ = 0;
  unsigned int max_depth_;
};

}  // namespace

int DecodeMessage(const char* data, size_t size, unsigned int max_depth,
                  PObject& out, size_t& used) {
  Reader r(data, size, max_depth);
  PObject obj;
  int rc = r.Element(obj, 0);
  if (rc == 1) {
    out.swap(obj);
    used = r.pos();
  }
  return rc;
}

unsigned int NestingDepth(const PObject& obj) {
  unsigned int deepest = 0;
  if (obj.isMap()) {
    for (const auto& m : obj.asMap()) {
      unsigned int d = NestingDepth(m.second);
      if (d > deepest) deepest = d;
    }
    return deepest + 1;
  }
  if (obj.isArray()) {
    for (const PObject& e : obj.asArray()) {
      unsigned int d = NestingDepth(e);
      if (d > deepest) deepest = d;
    }
    return deepest + 1;
  }
  return 0;
}

}  // namespace s2s_service
