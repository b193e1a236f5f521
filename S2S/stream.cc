// PStream: encoder and decoder of the tagged wire format (doc/wire_format.md).
#include "S2S/stream.h"

#include <string.h>

#include <algorithm>

#include "S2S/result_codes.h"

#define S2S_LOG_AREA "stream"
#include "S2S/log.h"

namespace S2S {

namespace {

// Every Channel failure under the codec becomes one I/O error.
int ChannelFailure(int r) {
  LOG_WARNING("Channel: %d", r);
  return kIOError;
}

// Width in bytes of the shortest of 1, 2, 4, 8 that holds `v`.
unsigned char IntegerWidth(unsigned long long v) {
  if (v <= 0xFFull) return 1;
  if (v <= 0xFFFFull) return 2;
  if (v <= 0xFFFFFFFFull) return 4;
  return 8;
}

class MutexLock {
 public:
  explicit MutexLock(pthread_mutex_t* m) : m_(m) { pthread_mutex_lock(m_); }
  ~MutexLock() { pthread_mutex_unlock(m_); }

 private:
  pthread_mutex_t* m_;
};

}  // namespace

PStream::PStream() : second_status(0), first_status(0), depth(0) {
  pthread_mutex_init(&mutex, nullptr);
}

PStream::~PStream() { pthread_mutex_destroy(&mutex); }

const char* PStream::Indent() const {
  static const char* const kIndent[12] = {"",
                                          "  ",
                                          "    ",
                                          "      ",
                                          "        ",
                                          "          ",
                                          "            ",
                                          "              ",
                                          "                ",
                                          "                  ",
                                          "                    ",
                                          "                      "};
  return kIndent[std::min(depth, 11u)];
}

// ---------------------------------------------------------------------------
// Writing.

int PStream::Send(Channel& ch, const PObject& obj) {
  int r = SendObject(ch, obj);
  if (r < 0) {
    DumpHistory();
    ClearHistory();
    return r;
  }
  r = ch.FlushWrite(0);
  ClearHistory();
  if (r < 0) return ChannelFailure(r);
  return 0;
}

int PStream::SendObject(Channel& ch, const PObject& obj) {
  if (obj.isNull()) return SendNull(ch);
  switch (obj.typeCode()) {
    case PObject::kInteger:
      return Send(ch, obj.asUInt64());
    case PObject::kString:
      return Send(ch, obj.asStringRef());
    case PObject::kMap:
      return Send(ch, obj.asMap());
    case PObject::kArray:
      return Send(ch, obj.asArray());
    default:
      return -1;
  }
}

int PStream::SendNull(Channel& ch) {
  UpdateStatus(0, 0);
  int r = ch.WriteByte(kTagNull);
  if (r >= 0) r = ch.WriteByte(0);
  return r < 0 ? ChannelFailure(r) : 0;
}

int PStream::Send(Channel& ch, const std::string& s) {
  UpdateStatus(0, 0);
  int r = ch.WriteByte(kTagString);
  // Only the low 16 bits of the length travel; longer strings are the
  // caller's error and corrupt the stream for the reader.
  if (r >= 0) r = ch.WriteInt16(static_cast<unsigned short>(s.size()));
  // One Write never takes more than the ring holds.
  const unsigned int cap = ch.GetCapacity();
  for (size_t off = 0; r >= 0 && off < s.size(); off += cap) {
    size_t n = std::min<size_t>(cap, s.size() - off);
    r = ch.Write(s.data() + off, static_cast<unsigned int>(n));
  }
  if (r < 0) return ChannelFailure(r);
  LOG_DEBUG("%s\"%s\"", Indent(), s.c_str());
  return 0;
}

int PStream::Send(Channel& ch, unsigned long long v) {
  UpdateStatus(0, 0);
  unsigned char w = IntegerWidth(v);
  char bytes[8];
  for (int i = w - 1; i >= 0; --i)
    bytes[i] = static_cast<char>(v >> (8 * (w - 1 - i)));
  int r = ch.WriteByte(kTagInteger);
  if (r >= 0) r = ch.WriteByte(w);
  if (r >= 0) r = ch.Write(bytes, w);
  if (r < 0) return ChannelFailure(r);
  LOG_DEBUG("%s%llu", Indent(), v);
  return 0;
}

int PStream::Send(Channel& ch, const std::map<std::string, PObject>& m) {
  int r = ch.WriteByte(kTagMap);
  if (r < 0) return ChannelFailure(r);
  LOG_DEBUG("%s{", Indent());
  ++depth;
  for (const auto& member : m) {
    const std::string& key = member.first;
    std::string stripped;
    if (!key.empty() && key[0] == '_') stripped = key.substr(1);
    const std::string& wire_key = key.empty() || key[0] != '_' ? key : stripped;
    r = Send(ch, wire_key);
    if (r < 0) return r;
    PushKey(wire_key);
    r = SendObject(ch, member.second);
    if (r < 0) return r;
    PopKey();
  }
  r = ch.WriteByte(kTagEnd);
  if (r < 0) return ChannelFailure(r);
  --depth;
  LOG_DEBUG("%s}", Indent());
  return 0;
}

int PStream::Send(Channel& ch, const std::vector<PObject>& a) {
  int r = ch.WriteByte(kTagArray);
  if (r < 0) return ChannelFailure(r);
  LOG_DEBUG("%s[", Indent());
  ++depth;
  for (const PObject& element : a) {
    r = SendObject(ch, element);
    if (r < 0) return r;
  }
  r = ch.WriteByte(kTagEnd);
  if (r < 0) return ChannelFailure(r);
  --depth;
  LOG_DEBUG("%s]", Indent());
  return 0;
}

// ---------------------------------------------------------------------------
// Reading.

int PStream::Recv(Channel& ch, PObject& obj) {
  int r = RecvObject(ch, obj);
  if (r < 0) DumpHistory();
  ClearHistory();
  return r < 0 ? r : 0;
}

int PStream::RecvTag(Channel& ch, unsigned char& tag) {
  int r = ch.ReadByte(&tag);
  return r < 0 ? ChannelFailure(r) : 0;
}

int PStream::RecvObject(Channel& ch, PObject& obj) {
  unsigned char tag;
  int r = RecvTag(ch, tag);
  if (r < 0) return r;
  return RecvDispatch(ch, tag, obj);
}

int PStream::RecvDispatch(Channel& ch, unsigned char tag, PObject& obj) {
  int r;
  switch (tag) {
    case kTagString: {
      std::string v;
      r = Recv(ch, v);
      if (r >= 0) {
        obj = std::move(v);
      } else if (!obj.isString()) {
        obj = std::string();
      }
      break;
    }
    case kTagInteger: {
      unsigned long long v = 0;
      r = Recv(ch, v);
      if (r >= 0) {
        obj = v;
      } else if (!obj.isInteger()) {
        obj = 0ull;
      }
      break;
    }
    case kTagMap:
      r = Recv(ch, obj.asMap());
      break;
    case kTagArray:
      r = Recv(ch, obj.asArray());
      break;
    case kTagNull: {
      unsigned char len;
      r = ch.ReadByte(&len);
      if (r < 0) return ChannelFailure(r);
      if (len != 0) {
        LOG_ERROR("expect length 0, but we've got %u", len);
        return kProtocolError;
      }
      obj.clear();
      return 0;
    }
    default:
      return Skip(ch, tag);
  }
  return r < 0 ? r : 0;
}

int PStream::Recv(Channel& ch, std::string& s) {
  UpdateStatus(0, 0);
  unsigned short len;
  int r = ch.ReadInt16(&len);
  if (r < 0) return ChannelFailure(r);
  // Short strings (keys, most values) are read into the stack and assigned
  // once; longer ones straight into the string.
  char small[128];
  char* bytes = small;
  if (len > sizeof small) {
    s.resize(len);
    bytes = &s[0];
  }
  if (len > 0) {
    r = ch.Read(bytes, len);
    if (r < 0) {
      s.clear();
      return ChannelFailure(r);
    }
  }
  // A string ends at its first zero byte, whatever the length said.
  size_t n = strnlen(bytes, len);
  if (bytes == small) {
    s.assign(small, n);
  } else {
    s.resize(n);
  }
  LOG_DEBUG("%s\"%s\"", Indent(), s.c_str());
  return 0;
}

int PStream::Recv(Channel& ch, unsigned long long& v) {
  UpdateStatus(0, 0);
  unsigned char w;
  int r = ch.ReadByte(&w);
  if (r < 0) return ChannelFailure(r);
  if (w > 8) {
    LOG_ERROR("PStream: integer width %u exceeds 8", w);
    return kProtocolError;
  }
  unsigned char bytes[8];
  if (w > 0) {
    r = ch.Read(reinterpret_cast<char*>(bytes), w);
    if (r < 0) return ChannelFailure(r);
  }
  unsigned long long x = 0;
  for (unsigned i = 0; i < w; ++i) x = (x << 8) | bytes[i];
  v = x;
  LOG_DEBUG("%s%llu", Indent(), v);
  return 0;
}

int PStream::Recv(Channel& ch, std::map<std::string, PObject>& m) {
  if (depth >= kMaxDepth) {
    LOG_ERROR("PStream: nesting deeper than %u levels", kMaxDepth);
    return kProtocolError;
  }
  LOG_DEBUG("%s{", Indent());
  ++depth;
  for (;;) {
    unsigned char tag;
    int r = RecvTag(ch, tag);
    if (r < 0) return r;
    if (tag == kTagEnd) break;
    if (tag != kTagString) {
      LOG_ERROR("PStream: expect string, but get tag %u", tag);
      return kProtocolError;
    }
    std::string key;
    r = Recv(ch, key);
    if (r < 0) return r;
    PushKey(key);
    // Senders write members in key order, so the end is the usual place
    // for a new key; the hint falls back to a full search otherwise.
    r = RecvObject(ch, m.try_emplace(m.end(), std::move(key))->second);
    if (r < 0) return r;
    PopKey();
  }
  --depth;
  LOG_DEBUG("%s}", Indent());
  return 0;
}

int PStream::Recv(Channel& ch, std::vector<PObject>& a) {
  if (depth >= kMaxDepth) {
    LOG_ERROR("PStream: nesting deeper than %u levels", kMaxDepth);
    return kProtocolError;
  }
  LOG_DEBUG("%s[", Indent());
  ++depth;
  for (;;) {
    unsigned char tag;
    int r = RecvTag(ch, tag);
    if (r < 0) return r;
    if (tag == kTagEnd) break;
    PObject element;
    r = RecvDispatch(ch, tag, element);
    if (r < 0) return r;
    a.push_back(std::move(element));
  }
  --depth;
  LOG_DEBUG("%s]", Indent());
  return 0;
}

int PStream::Skip(Channel& /*ch*/, unsigned char /*tag*/) {
  return kProtocolError;
}

// ---------------------------------------------------------------------------
// History and status.

void PStream::PushKey(const std::string& key) {
  MutexLock lock(&mutex);
  history.push_back(key);
}

void PStream::PopKey() {
  MutexLock lock(&mutex);
  history.pop_back();
}

void PStream::ClearHistory() {
  {
    MutexLock lock(&mutex);
    history.clear();
    first_status.store(0, std::memory_order_relaxed);
    second_status.store(0, std::memory_order_relaxed);
  }
  depth = 0;
}

std::string PStream::GetHistory() {
  if (history.empty()) return std::string();
  std::string text = history.front();
  for (const std::string& key : history) text += "." + key;
  return text;
}

void PStream::DumpHistory() {
  MutexLock lock(&mutex);
  LOG_ERROR("Error stack: %s", GetHistory().c_str());
}

void PStream::UpdateStatus(unsigned long long first,
                           unsigned long long second) {
  // Every primitive reports (0, 0), which the counters nearly always hold
  // already; storing equal values again would change nothing a reader under
  // the mutex can see, so the lock is taken only for a real change. Updates
  // come from the thread running the codec (the mutex is for readers), so
  // the values seen here are the current ones.
  if (first_status.load(std::memory_order_relaxed) == first &&
      second_status.load(std::memory_order_relaxed) == second) {
    return;
  }
  MutexLock lock(&mutex);
  first_status.store(first, std::memory_order_relaxed);
  second_status.store(second, std::memory_order_relaxed);
}

void PStream::GetStatus(std::string& h, unsigned long long& first,
                        unsigned long long& second) {
  MutexLock lock(&mutex);
  h = GetHistory();
  first = first_status.load(std::memory_order_relaxed);
  second = second_status.load(std::memory_order_relaxed);
}

void PStream::SetDefaultRecvLocation(const std::string& location) {
  default_recv_location = location;
}

void PStream::GetVersion(unsigned int& major, unsigned int& minor,
                         unsigned int& patch) {
  major = 1;
  minor = 0;
  patch = 0;
}

}  // namespace S2S
