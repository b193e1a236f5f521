#include "S2S/stream.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <string>

#include "S2S/result_codes.h"
#include "testutil.h"

namespace {

using S2S::Channel;
using S2S::PObject;
using S2S::PStream;
using s2s_test::Has;
using s2s_test::LogCapture;

std::string Bytes(std::initializer_list<int> b) {
  std::string s;
  for (int c : b) s.push_back(static_cast<char>(c));
  return s;
}

// A channel, `a`, whose peer the test feeds raw bytes.
struct Wire : s2s_test::ChannelPair {
  Wire() : ChannelPair(256) { a.SetTimeout(1); }
  // Feeds `bytes` and ends the stream, then decodes one message into `obj`.
  int Decode(const std::string& bytes, PObject& obj) {
    if (write(peer, bytes.data(), bytes.size()) !=
        static_cast<ssize_t>(bytes.size())) {
      return 1;
    }
    shutdown(peer, SHUT_WR);
    return stream.Recv(a, obj);
  }

  PStream stream;
};

TEST(PStreamTest, ValuesTravelAsTheirExactBytes) {
  PObject empty_map, empty_array, array_of_null, map, underscored;
  empty_map.asMap();
  empty_array.asArray();
  array_of_null.asArray().emplace_back();
  map["a"] = 5ull;
  map["b"] = "";
  underscored["_tmp"] = 1ull;
  underscored["a_b"] = 2ull;
  underscored["_"] = 3ull;
  const struct {
    PObject value;
    std::string bytes;
    const char* decoded = nullptr;  // nullptr: the value itself
  } cases[] = {
      {PObject(), Bytes({0x00, 0x00})},
      {PObject(0ull), Bytes({0x01, 0x01, 0x00})},
      {PObject(255ull), Bytes({0x01, 0x01, 0xFF})},
      {PObject(256ull), Bytes({0x01, 0x02, 0x01, 0x00})},
      {PObject(65536ull), Bytes({0x01, 0x04, 0x00, 0x01, 0x00, 0x00})},
      {PObject(4294967296ull), Bytes({0x01, 0x08, 0, 0, 0, 0x01, 0, 0, 0, 0})},
      {PObject("hi"), Bytes({0x10, 0x00, 0x02, 'h', 'i'})},
      // Four times the 256-byte ring: split into ring-sized writes.
      {PObject(std::string(1000, 'q')),
       Bytes({0x10, 0x03, 0xE8}) + std::string(1000, 'q')},
      {empty_map, Bytes({0x42, 0x40})},
      {empty_array, Bytes({0x41, 0x40})},
      {array_of_null, Bytes({0x41, 0x00, 0x00, 0x40})},
      {map, Bytes({0x42, 0x10, 0x00, 0x01, 0x61, 0x01, 0x01, 0x05, 0x10, 0x00,
                   0x01, 0x62, 0x10, 0x00, 0x00, 0x40})},
      // Keys in map order: "_", "_tmp", "a_b"; a leading underscore drops.
      {underscored, Bytes({0x42, 0x10, 0x00, 0x00, 0x01, 0x01, 0x03, 0x10, 0x00,
                           0x03, 't',  'm',  'p',  0x01, 0x01, 0x01, 0x10, 0x00,
                           0x03, 'a',  '_',  'b',  0x01, 0x01, 0x02, 0x40}),
       "{\"\": 3, \"a_b\": 2, \"tmp\": 1}"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.value.toString());
    Wire w;
    ASSERT_TRUE(w.ok);
    ASSERT_EQ(w.stream.Send(w.a, c.value), 0);
    std::string sent(2048, '\0');
    ssize_t n = recv(w.peer, &sent[0], sent.size(), MSG_DONTWAIT);
    EXPECT_EQ(sent.substr(0, n > 0 ? n : 0), c.bytes);
    PObject got;
    ASSERT_EQ(Wire().Decode(c.bytes, got), 0);
    EXPECT_EQ(got.toString(), c.decoded ? c.decoded : c.value.toString());
  }
}

TEST(PStreamTest, ReceivingMergesIntoWhatTheObjectHolds) {
  PObject map;
  map["keep"] = "old";
  map["a"] = "replaced";
  map["b"]["inner"] = 1ull;
  // {a: 5, b: {x: "y"}}
  ASSERT_EQ(Wire().Decode(Bytes({0x42, 0x10, 0, 1,   'a',  0x01, 0x01, 0x05,
                                 0x10, 0,    1, 'b', 0x42, 0x10, 0,    1,
                                 'x',  0x10, 0, 1,   'y',  0x40, 0x40}),
                          map),
            0);
  EXPECT_EQ(
      map.toString(),
      "{\"a\": 5, \"b\": {\"inner\": 1, \"x\": \"y\"}, \"keep\": \"old\"}");
  PObject array;
  array.asArray().emplace_back("first");
  ASSERT_EQ(Wire().Decode(Bytes({0x41, 0x10, 0, 1, 'z', 0x40}), array), 0);
  EXPECT_EQ(array.toString(), "[\"first\", \"z\"]");
}

// Short strings are received through a stack buffer, long ones in place:
// both sides of that line keep every byte and stop at the first zero.
TEST(PStreamTest, StringsOfEveryLengthArriveCutAtTheirFirstZero) {
  const size_t npos = std::string::npos;
  const struct {
    size_t len, zero_at;
  } cases[] = {{0, npos},  {1, 0},      {3, 1},     {127, npos}, {128, npos},
               {128, 127}, {129, npos}, {129, 128}, {700, 3},    {700, npos}};
  for (const auto& c : cases) {
    std::string body(c.len, '\0');
    for (size_t i = 0; i < c.len; ++i) body[i] = 'A' + i % 26;
    if (c.zero_at != npos) body[c.zero_at] = '\0';
    PObject got;
    std::string msg = Bytes({0x10, int(c.len >> 8), int(c.len & 0xFF)}) + body;
    ASSERT_EQ(Wire().Decode(msg, got), 0) << c.len;
    EXPECT_EQ(got.asStringRef(), body.substr(0, c.zero_at)) << c.len;
  }
}

TEST(PStreamTest, MalformedOrTooDeepInputIsAProtocolError) {
  const std::string deepest = std::string(PStream::kMaxDepth, 0x41) +
                              std::string(PStream::kMaxDepth, 0x40);
  const struct {
    std::string bytes;
    std::string logged;  // "": accepted
  } cases[] = {
      {Bytes({0x00, 0x01}), "expect length 0, but we've got 1"},
      {Bytes({0x40}), "Error stack: "},
      {Bytes({0x42, 0x01, 0x01, 0x05, 0x40}),
       "PStream: expect string, but get tag 1"},
      {Bytes({0x41, 0x40, 0x40}), ""},  // trailing byte left unread
      {Bytes({0x42, 0x10, 0, 1, 'k', 0x77, 0x40}), "Error stack: k.k"},
      {Bytes({0x01, 0x09, 1, 2, 3, 4, 5, 6, 7, 8, 9}),
       "integer width 9 exceeds 8"},
      {Bytes({0x42, 0x10, 0, 1, 'a', 0x42, 0x10, 0, 1, 'b', 0x00, 0x07}),
       "Error stack: a.a.b"},
      {std::string(5000, 0x41), "nesting deeper than 512"},
      {deepest, ""},
  };
  for (const auto& c : cases) {
    LogCapture log(3);
    PObject obj;
    int r = Wire().Decode(c.bytes, obj);
    EXPECT_EQ(r, c.logged.empty() ? 0 : S2S::kProtocolError) << c.logged;
    EXPECT_TRUE(Has(log.Text(), c.logged)) << log.Text();
  }
  // Cut short inside a string: the end of the stream, not a hang or less.
  PObject cut;
  EXPECT_EQ(Wire().Decode(Bytes({0x10, 0, 5, 'a', 'b'}), cut), S2S::kIOError);
}

}  // namespace
