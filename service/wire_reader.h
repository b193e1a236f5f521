// Decoding one PStream message from bytes as they arrive, so that the
// service can read a request with a deadline and a size limit of its own
// instead of blocking on a peer. The grammar is doc/wire_format.md's; the
// result is what PStream::Recv would give for the same bytes.
#ifndef S2S_SERVICE_WIRE_READER_H_
#define S2S_SERVICE_WIRE_READER_H_

#include <stddef.h>

#include "S2S/pobject.h"

namespace s2s_service {

// Decodes the message at the start of `data`. Returns 1 with `out` set and
// `used` the message's length, 0 when the bytes end before the message
// does, -1 when they cannot be a message (an unknown tag, a map member
// without a string key, an integer wider than 8 bytes, containers nested
// deeper than `max_depth`).
int DecodeMessage(const char* data, size_t size, unsigned int max_depth,
                  S2S::PObject& out, size_t& used);

// Depth of nested containers in `obj`: 0 for a leaf, 1 for a flat map.
unsigned int NestingDepth(const S2S::PObject& obj);

}  // namespace s2s_service

#endif  // S2S_SERVICE_WIRE_READER_H_
