#include "framework/wire.h"

#include <gtest/gtest.h>

namespace {

TEST(Wire, RoundTripOfEveryFieldKindInLittleEndian) {
  std::string out;
  wire::Writer w(out);
  w.u32(0x01020304);
  EXPECT_EQ(out, std::string("\x04\x03\x02\x01", 4));
  w.u8(0xAB);
  w.boolean(true);
  w.i32(-5);
  w.u64(0x0102030405060708ULL);
  w.i64(-1);
  w.str(std::string("a\0b", 3));
  w.bytes("xyz", 3);
  w.strList({"", "one", "two"});

  wire::Reader r(out);
  EXPECT_EQ(r.u32(), 0x01020304u);
  EXPECT_EQ(r.u8(), 0xAB);
  EXPECT_TRUE(r.boolean());
  EXPECT_EQ(r.i32(), -5);
  EXPECT_EQ(r.u64(), 0x0102030405060708ULL);
  EXPECT_EQ(r.i64(), -1);
  EXPECT_EQ(r.str(), std::string("a\0b", 3));
  EXPECT_EQ(r.bytes(), "xyz");
  EXPECT_EQ(r.strList(), (std::vector<std::string>{"", "one", "two"}));
  EXPECT_NO_THROW(r.expectEnd());
}

TEST(Wire, MalformedMessagesAreRefusedBeforeAnythingIsAllocated) {
  // Readers do not own their bytes: keep the messages alive. A string that
  // claims 4 GiB, a byte string that claims 2^63 bytes and a list that
  // claims 2^32-1 entries, each in a message of a few bytes.
  const std::string bigString(
      "\xff\xff\xff\xff"
      "ab",
      6),
      bigBytes(
          "\0\0\0\0\0\0\0\x80"
          "ab",
          10),
      bigList("\xff\xff\xff\xff", 4), shortInt("\x01\x02\x03", 3), badBool("\x02", 1), trailing("\x01\x02", 2);
  EXPECT_THROW(wire::Reader(bigString).str(), wire::DecodeError);
  EXPECT_THROW(wire::Reader(bigBytes).bytes(), wire::DecodeError);
  EXPECT_THROW(wire::Reader(bigList).strList(), wire::DecodeError);
  EXPECT_THROW(wire::Reader(shortInt).u32(), wire::DecodeError);
  EXPECT_THROW(wire::Reader(badBool).boolean(), wire::DecodeError);
  wire::Reader r(trailing);
  r.u8();
  EXPECT_THROW(r.expectEnd(), wire::DecodeError);
}

}  // namespace
