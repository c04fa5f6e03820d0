// The frame decoder fed bytes directly: any split of the stream gives the same
// messages, and a length prefix over the limit stops it for good without
// consuming what follows.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <string>
#include <vector>

#include "pm/ipc/framing.h"
#include "pm/runtime/little_endian.h"

namespace {

std::string Prefix(std::uint32_t n) {
  std::string out(4, '\0');
  pm::StoreLe32(out.data(), n);
  return out;
}

std::string Frame(const std::string& text) { return Prefix(static_cast<std::uint32_t>(text.size())) + text; }

std::vector<std::string> Drain(pm::ipc::FrameReader& reader) {
  std::vector<std::string> out;
  std::string message;
  while (reader.Next(&message)) out.push_back(message);
  return out;
}

TEST(FrameReader, AnySplitOfTheStreamGivesTheSameMessagesInOrder) {
  const std::string stream = Frame("{\"a\":1}") + Frame("") + Frame("second") + Frame(std::string(300, 'x'));
  const std::vector<std::string> expected = {"{\"a\":1}", "", "second", std::string(300, 'x')};

  pm::ipc::FrameReader whole;
  EXPECT_EQ(whole.Feed(stream.data(), stream.size()), stream.size());
  EXPECT_EQ(Drain(whole), expected);
  EXPECT_FALSE(whole.MidFrame());

  for (std::size_t chunk : {1u, 2u, 3u, 5u, 7u}) {
    pm::ipc::FrameReader reader;
    std::vector<std::string> got;
    for (std::size_t at = 0; at < stream.size(); at += chunk) {
      const std::size_t n = std::min(chunk, stream.size() - at);
      ASSERT_EQ(reader.Feed(stream.data() + at, n), n);
      for (auto& m : Drain(reader)) got.push_back(m);
    }
    EXPECT_EQ(got, expected) << "chunk " << chunk;
    EXPECT_FALSE(reader.MidFrame());
  }
}

TEST(FrameReader, MessageAppearsOnlyWithItsLastByte) {
  const std::string stream = Frame("hello");
  pm::ipc::FrameReader reader;
  for (std::size_t i = 0; i + 1 < stream.size(); ++i) {
    reader.Feed(&stream[i], 1);
    EXPECT_EQ(reader.Ready(), 0u) << i;
    EXPECT_TRUE(reader.MidFrame()) << i;
  }
  reader.Feed(&stream.back(), 1);
  EXPECT_EQ(Drain(reader), std::vector<std::string>{"hello"});
}

TEST(FrameReader, ExactLimitIsAcceptedOneByteMoreStopsTheStream) {
  pm::ipc::FrameReader atLimit;
  const std::string header = Prefix(pm::ipc::kMaxFrameBytes);
  atLimit.Feed(header.data(), header.size());
  EXPECT_FALSE(atLimit.Oversize());
  EXPECT_EQ(atLimit.Wanted(), pm::ipc::kMaxFrameBytes);
  const std::string body(pm::ipc::kMaxFrameBytes, 'b');
  EXPECT_EQ(atLimit.Feed(body.data(), body.size()), body.size());
  std::string message;
  ASSERT_TRUE(atLimit.Next(&message));
  EXPECT_EQ(message.size(), pm::ipc::kMaxFrameBytes);

  // The bytes after an oversize prefix are not consumed, nothing queues up,
  // and the reader stays stopped whatever comes next.
  pm::ipc::FrameReader over;
  const std::string stream = Prefix(pm::ipc::kMaxFrameBytes + 1) + Frame("after");
  EXPECT_EQ(over.Feed(stream.data(), stream.size()), 4u);
  EXPECT_TRUE(over.Oversize());
  EXPECT_EQ(over.OversizeLength(), pm::ipc::kMaxFrameBytes + 1);
  EXPECT_EQ(over.Wanted(), 0u);
  EXPECT_EQ(over.Feed(stream.data() + 4, stream.size() - 4), 0u);
  EXPECT_EQ(over.Ready(), 0u);
}

TEST(FrameReader, GarbageLengthIsOversizeNotAnAllocation) {
  pm::ipc::FrameReader reader;
  const std::string stream = Frame("ok") + "\xff\xff\xff\xff" + "tail";
  EXPECT_EQ(reader.Feed(stream.data(), stream.size()), Frame("ok").size() + 4);
  EXPECT_TRUE(reader.Oversize());
  EXPECT_EQ(reader.OversizeLength(), 0xFFFFFFFFu);
  // The frame before the bad prefix is kept.
  EXPECT_EQ(Drain(reader), std::vector<std::string>{"ok"});
}

TEST(FrameReader, ExactBlockReadsThroughWritePointer) {
  // The way the receive loop uses it: read exactly Wanted() bytes into
  // WritePointer(), possibly in parts, then Commit.
  const std::string stream = Frame("abc") + Frame("");
  pm::ipc::FrameReader reader;
  std::size_t at = 0;
  while (at < stream.size()) {
    const std::size_t wanted = reader.Wanted();
    ASSERT_GT(wanted, 0u);
    const std::size_t n = std::min<std::size_t>(wanted, 2);  // short reads
    std::memcpy(reader.WritePointer(), stream.data() + at, n);
    reader.Commit(n);
    at += n;
  }
  EXPECT_EQ(Drain(reader), (std::vector<std::string>{"abc", ""}));
  EXPECT_EQ(reader.Wanted(), 4u);
}

}  // namespace
