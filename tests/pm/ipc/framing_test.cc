// The frame decoder fed bytes directly: any split of the stream gives the same
// messages, and a length prefix over the limit stops it for good without
// consuming what follows.
#include <gtest/gtest.h>

#include <algorithm>
#include <string>
#include <vector>

#include "pm/ipc/framing.h"
#include "support/host_socket.h"

namespace {

using pm::ipc::EncodeFrame;
using pm::ipc::FrameReader;
using Messages = std::vector<std::string>;

Messages Drain(FrameReader& reader) {
  Messages out;
  for (std::string message; reader.Next(&message);) out.push_back(message);
  return out;
}

// Feeds `stream` in pieces of `chunk` bytes (0: at once) and returns the
// messages.
Messages FeedInChunks(const std::string& stream, std::size_t chunk) {
  FrameReader reader;
  Messages got;
  const std::size_t step = chunk == 0 ? stream.size() : chunk;
  for (std::size_t at = 0; at < stream.size(); at += step) {
    const std::size_t n = std::min(step, stream.size() - at);
    EXPECT_EQ(reader.Feed(stream.data() + at, n), n);
    for (auto& m : Drain(reader)) got.push_back(m);
  }
  EXPECT_FALSE(reader.MidFrame());
  return got;
}

TEST(FrameReader, AnySplitOfTheStreamGivesTheSameMessagesInOrder) {
  const Messages expected = {"{\"a\":1}", "", "second", std::string(300, 'x')};
  std::string stream;
  for (const auto& m : expected) stream += EncodeFrame(m);
  for (std::size_t chunk : {0u, 1u, 2u, 3u, 5u, 7u}) EXPECT_EQ(FeedInChunks(stream, chunk), expected) << chunk;
  // One byte at a time, a message appears only with its last byte.
  const std::string hello = EncodeFrame("hello");
  FrameReader reader;
  for (std::size_t i = 0; i < hello.size(); ++i) {
    reader.Feed(&hello[i], 1);
    const bool last = i + 1 == hello.size();
    EXPECT_EQ(std::make_pair(reader.Ready(), reader.MidFrame()), std::make_pair(std::size_t{last}, !last)) << i;
  }
}

// (The exact limit and one byte more, through the dispatcher, are tested
// there.) Bytes after a bad prefix, also one whose length would wrap a
// 32-bit sum, are not consumed and the reader stays stopped whatever comes
// next; frames before it are kept.
TEST(FrameReader, LengthOverTheLimitStopsTheStreamForGood) {
  for (const std::uint32_t length : {pm::ipc::kMaxFrameBytes + 1, 0xFFFFFFFFu}) {
    SCOPED_TRACE(length);
    FrameReader reader;
    const std::string before = EncodeFrame("ok");
    const std::string stream = before + pmtest::HostPeer::Prefix(length) + EncodeFrame("after");
    EXPECT_EQ(reader.Feed(stream.data(), stream.size()), before.size() + 4);
    EXPECT_EQ(reader.Feed(stream.data() + before.size() + 4, 9), 0u);
    EXPECT_EQ(Drain(reader), Messages{"ok"});
  }
}

}  // namespace
