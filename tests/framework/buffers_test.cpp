#include "framework/buffers.h"

#include <gtest/gtest.h>

namespace {

TEST(Buffers, EmptyBuffersAreNullWithLengthZero) {
  MemBuffer m;
  EXPECT_EQ(m.data(), nullptr);
  EXPECT_EQ(m.size(), 0u);
  MemBuffer zero(0);
  EXPECT_EQ(zero.data(), nullptr);
  SharedMemBuffer s{MemBuffer()};
  EXPECT_EQ(s.data(), nullptr);
  EXPECT_EQ(s.size(), 0u);
  EXPECT_EQ(s.owner().use_count(), 0);
}

TEST(Buffers, SharedBufferTakesTheBytesOverWithoutCopying) {
  MemBuffer m = MemBuffer::copyOf("hello");
  unsigned char* bytes = m.data();
  SharedMemBuffer s(std::move(m));
  EXPECT_EQ(m.data(), nullptr);
  EXPECT_EQ(m.size(), 0u);
  EXPECT_EQ(s.data(), bytes);
  EXPECT_EQ(s.view(), "hello");
  SharedMemBuffer other = s;
  EXPECT_EQ(s.owner().use_count(), 2);
}

}  // namespace
