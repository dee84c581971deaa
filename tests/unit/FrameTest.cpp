#include "protocol/Frame.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <stdexcept>
#include <vector>

namespace tavrin::protocol {
namespace {

using Bytes = std::vector<uint8_t>;

Bytes Body(size_t size, uint8_t seed) {
  Bytes body(size);
  for (size_t i = 0; i < size; ++i) body[i] = static_cast<uint8_t>(seed + i * 7);
  return body;
}

Bytes Concat(const std::vector<Bytes>& parts) {
  Bytes all;
  for (const Bytes& part : parts) all.insert(all.end(), part.begin(), part.end());
  return all;
}

// Drains every complete frame; stops at kNeedMore or kBadLength and reports which.
FrameReader::Status Drain(FrameReader& reader, std::vector<Bytes>& frames) {
  for (;;) {
    const FrameReader::Status status = reader.Next();
    if (status != FrameReader::Status::kFrame) return status;
    frames.emplace_back(reader.Body().begin(), reader.Body().end());
  }
}

TEST(FrameTest, EncodeWritesBigEndianLengthThenBody) {
  const Bytes body = Body(0x010203, 1);
  const Bytes frame = EncodeFrame(body);
  ASSERT_EQ(frame.size(), 4 + body.size());
  EXPECT_EQ(Bytes(frame.begin(), frame.begin() + 4), (Bytes{0x00, 0x01, 0x02, 0x03}));
  EXPECT_EQ(Bytes(frame.begin() + 4, frame.end()), body);
}

TEST(FrameTest, EncodeRefusesAnEmptyBody) { EXPECT_THROW(EncodeFrame({}), std::length_error); }

TEST(FrameTest, ByteAtATimeYieldsEveryFrameOnceAndInOrder) {
  const std::vector<Bytes> bodies = {Body(1, 0), Body(300, 1), Body(5, 2), Body(70000, 3)};
  std::vector<Bytes> encoded;
  for (const Bytes& body : bodies) encoded.push_back(EncodeFrame(body));
  const Bytes stream = Concat(encoded);

  FrameReader reader;
  std::vector<Bytes> frames;
  size_t boundary = 0;
  size_t frameIndex = 0;
  for (size_t i = 0; i < stream.size(); ++i) {
    reader.Append({&stream[i], 1});
    ASSERT_EQ(Drain(reader, frames), FrameReader::Status::kNeedMore);
    if (i + 1 == boundary + encoded[frameIndex].size()) {
      // The last byte of a frame completes it, and the stream is then at a boundary.
      ASSERT_EQ(frames.size(), frameIndex + 1);
      EXPECT_FALSE(reader.InsideFrame());
      boundary = i + 1;
      ++frameIndex;
    } else {
      ASSERT_EQ(frames.size(), frameIndex) << "frame yielded early at byte " << i;
      EXPECT_TRUE(reader.InsideFrame()) << "byte " << i;
    }
  }
  EXPECT_EQ(frames, bodies);
  EXPECT_EQ(reader.Buffered(), 0u);
}

TEST(FrameTest, OneBigChunkYieldsAllFramesAndKeepsThePartialTail) {
  std::vector<Bytes> bodies;
  std::vector<Bytes> encoded;
  for (int i = 0; i < 200; ++i) {
    bodies.push_back(Body(1 + i * 13, static_cast<uint8_t>(i)));
    encoded.push_back(EncodeFrame(bodies.back()));
  }
  Bytes stream = Concat(encoded);
  const Bytes next = EncodeFrame(Body(40, 9));
  stream.insert(stream.end(), next.begin(), next.begin() + 10);  // header and 6 body bytes

  FrameReader reader;
  reader.Append(stream);
  std::vector<Bytes> frames;
  EXPECT_EQ(Drain(reader, frames), FrameReader::Status::kNeedMore);
  EXPECT_EQ(frames, bodies);
  EXPECT_TRUE(reader.InsideFrame());
  EXPECT_EQ(reader.Buffered(), 10u);

  reader.Append({next.data() + 10, next.size() - 10});
  ASSERT_EQ(reader.Next(), FrameReader::Status::kFrame);
  EXPECT_EQ(Bytes(reader.Body().begin(), reader.Body().end()), Body(40, 9));
  EXPECT_FALSE(reader.InsideFrame());
}

// A header alone decides: zero and anything over the limit fail before a body byte arrives, and
// for good: the frame before is still delivered, and later bytes are ignored.
TEST(FrameTest, ZeroAndLengthsOverTheLimitFailForGoodAndTheLimitItselfIsAccepted) {
  struct Case {
    uint32_t limit;
    uint32_t length;
    bool bad;
  };
  const Bytes good = EncodeFrame(Body(3, 1));
  for (const Case& c :
       {Case{kDefaultFrameLimit, 0, true}, Case{kDefaultFrameLimit, kDefaultFrameLimit + 1, true},
        Case{1000, 1000, false}, Case{1000, 1001, true}}) {
    SCOPED_TRACE(::testing::Message() << "limit " << c.limit << " length " << c.length);
    FrameReader reader(c.limit);
    EXPECT_EQ(reader.FrameLimit(), c.limit);
    const Bytes header = {static_cast<uint8_t>(c.length >> 24),
                          static_cast<uint8_t>(c.length >> 16), static_cast<uint8_t>(c.length >> 8),
                          static_cast<uint8_t>(c.length)};
    reader.Append(good);
    reader.Append(header);
    ASSERT_EQ(reader.Next(), FrameReader::Status::kFrame);
    if (!c.bad) {
      EXPECT_EQ(reader.Next(), FrameReader::Status::kNeedMore);
      reader.Append(Body(c.length, 4));
      ASSERT_EQ(reader.Next(), FrameReader::Status::kFrame);
      EXPECT_EQ(Bytes(reader.Body().begin(), reader.Body().end()), Body(c.length, 4));
      continue;
    }
    EXPECT_EQ(reader.Next(), FrameReader::Status::kBadLength);
    EXPECT_TRUE(reader.Failed());
    EXPECT_EQ(reader.BadLength(), c.length);
    reader.Append(good);
    EXPECT_EQ(reader.Next(), FrameReader::Status::kBadLength);
    EXPECT_EQ(reader.Buffered(), 0u);
    EXPECT_FALSE(reader.InsideFrame());
  }
}

}  // namespace
}  // namespace tavrin::protocol
