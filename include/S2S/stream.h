// PStream: the tagged binary encoding of a PObject on a Channel.
//
// A message is one element: null, integer, string, array or map, each opened
// by a tag byte (the grammar is in doc/wire_format.md). Send() encodes one
// message and flushes it; Recv() decodes one message into an object, merging
// into a map or appending to an array the object already holds. Besides the
// codec a PStream keeps the path of map keys being processed (logged as the
// "Error stack" when a message fails), a nesting depth and two status
// counters.
//
// Decisions of this implementation:
// - An integer whose width byte exceeds 8 is refused with -5.
// - Received containers may nest at most kMaxDepth levels; a deeper message
//   is refused with -5 before the decoder's recursion can exhaust the stack.
//   Sending does not check the depth: the caller owns what it sends.
//
// All calls return a result code (S2S/result_codes.h): 0 on success, -2 for
// any Channel failure, -5 for malformed input, -1 for an object of unknown
// kind. After a failure the channel cannot be resynchronised; close it.
//
// Thread-safety: one PStream serves one connection at a time. The mutex only
// lets another thread read the history and counters (GetStatus,
// DumpHistory) while a message is in flight.
#ifndef S2S_STREAM_H_
#define S2S_STREAM_H_

#include <pthread.h>

#include <atomic>
#include <map>
#include <string>
#include <vector>

#include "S2S/channel.h"
#include "S2S/export.h"
#include "S2S/pobject.h"

namespace S2S {

class S2S_EXPORT PStream {
 public:
  // Tags, the first byte of every element.
  enum Tag : unsigned char {
    kTagNull = 0x00,
    kTagInteger = 0x01,
    kTagString = 0x10,
    kTagEnd = 0x40,
    kTagArray = 0x41,
    kTagMap = 0x42,
  };
  // Deepest container nesting a received message may have.
  static constexpr unsigned int kMaxDepth = 512;

  PStream();
  ~PStream();
  PStream(const PStream&) = delete;
  PStream& operator=(const PStream&) = delete;

  // One whole message: encode and flush / decode. On failure the key path
  // is logged as "Error stack"; the history is cleared in every case.
  int Send(Channel& ch, const PObject& obj);
  int Recv(Channel& ch, PObject& obj);

  // Building blocks. SendObject encodes one element by the object's kind.
  int SendObject(Channel& ch, const PObject& obj);
  int SendNull(Channel& ch);
  int Send(Channel& ch, const std::string& s);
  int Send(Channel& ch, unsigned long long v);
  // Keys with a leading underscore go on the wire without it.
  int Send(Channel& ch, const std::map<std::string, PObject>& m);
  int Send(Channel& ch, const std::vector<PObject>& a);

  int RecvTag(Channel& ch, unsigned char& tag);
  int RecvObject(Channel& ch, PObject& obj);
  // Decodes the body of an element whose tag has been read.
  int RecvDispatch(Channel& ch, unsigned char tag, PObject& obj);
  // Bodies of a string (cut at its first zero byte), an integer, a map
  // (merged into `m`) and an array (appended to `a`).
  int Recv(Channel& ch, std::string& s);
  int Recv(Channel& ch, unsigned long long& v);
  int Recv(Channel& ch, std::map<std::string, PObject>& m);
  int Recv(Channel& ch, std::vector<PObject>& a);
  // The handler for unknown tags: consumes nothing, returns -5.
  int Skip(Channel& ch, unsigned char tag);

  // Tag and PObject type code of each value type.
  template <typename T>
  static unsigned char GetTag();
  template <typename T>
  static int GetType();

  void ClearHistory();
  // The first key, then "." and each key from the first to the last (the
  // first key therefore appears twice: keys a, b give "a.a.b"). No lock.
  std::string GetHistory();
  void DumpHistory();
  void UpdateStatus(unsigned long long first, unsigned long long second);
  void GetStatus(std::string& history, unsigned long long& first,
                 unsigned long long& second);
  // Stored for callers; the codec does not use it.
  void SetDefaultRecvLocation(const std::string& location);
  // The format version, 1.0.0; never transmitted.
  void GetVersion(unsigned int& major, unsigned int& minor,
                  unsigned int& patch);

 private:
  void PushKey(const std::string& key);
  void PopKey();
  const char* Indent() const;

  std::vector<std::string> history;
  // Written under the mutex; atomic so that UpdateStatus may look at them
  // without it.
  std::atomic<unsigned long long> second_status;
  std::atomic<unsigned long long> first_status;
  pthread_mutex_t mutex;
  unsigned int depth;
  std::string default_recv_location;
};

template <>
inline unsigned char PStream::GetTag<unsigned long long>() {
  return kTagInteger;
}
template <>
inline unsigned char PStream::GetTag<std::string>() {
  return kTagString;
}
template <>
inline unsigned char PStream::GetTag<std::vector<PObject>>() {
  return kTagArray;
}
template <>
inline unsigned char PStream::GetTag<std::map<std::string, PObject>>() {
  return kTagMap;
}
template <>
inline int PStream::GetType<unsigned long long>() {
  return PObject::kInteger;
}
template <>
inline int PStream::GetType<std::string>() {
  return PObject::kString;
}
template <>
inline int PStream::GetType<std::vector<PObject>>() {
  return PObject::kArray;
}
template <>
inline int PStream::GetType<std::map<std::string, PObject>>() {
  return PObject::kMap;
}

}  // namespace S2S

#endif  // S2S_STREAM_H_
