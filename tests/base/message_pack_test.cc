#include "base/MessagePack.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <limits>

#include "base/Payload.h"

namespace quarvel {
namespace {

using Progress = MessagePackScanner::Progress;

std::string Encoded(const Value& value) {
  std::string bytes;
  MessagePackWriter(bytes).value(value);
  return bytes;
}

List EveryForm() {
  List forms{nullptr, true, false, Value(1.5), Value(-0.0), Bytes{"\x00\xff"}, "text"};
  for (const int bits : {5, 7, 8, 15, 16, 31, 32, 62, 63}) {
    const std::uint64_t edge = std::uint64_t{1} << bits;
    forms.insert(forms.end(), {edge - 1, edge, -static_cast<std::int64_t>(edge - 1) - 1,
                               -static_cast<std::int64_t>(edge - 1)});
  }
  forms.emplace_back(std::numeric_limits<std::uint64_t>::max());
  for (const std::size_t length : {0U, 31U, 32U, 255U, 256U, 65'535U, 65'536U}) {
    forms.emplace_back(std::string(length, 's'));
    forms.emplace_back(Bytes{std::string(length, 'b')});
  }
  for (const std::size_t count : {15U, 16U, 65'536U}) forms.emplace_back(List(count, Value(1)));
  Dictionary large{{7, "seven"}, {-7, "minus seven"}, {"7", "text"}};
  for (int i = 0; i < 70'000; ++i) large.set(i, i);
  forms.emplace_back(std::move(large));
  for (const std::int64_t microseconds :
       {std::int64_t{0}, std::int64_t{1}, std::int64_t{-1}, std::int64_t{1'769'865'901'123'456},
        std::int64_t{4'294'967'296'000'000}, std::int64_t{17'179'869'184'000'000}}) {
    forms.emplace_back(Date(std::chrono::microseconds(microseconds)));
  }
  forms.emplace_back(kEarliestDate);
  forms.emplace_back(kLatestDate);
  return forms;
}

TEST(MessagePack, EveryFormComesBackAsItWasWritten) {
  for (const Value& form : EveryForm()) {
    const std::string bytes = Encoded(form);
    MessagePackScanner scanner(bytes.size(), 4);
    ASSERT_EQ(scanner.scan(bytes), Progress::complete) << scanner.fault();
    EXPECT_EQ(scanner.length(), bytes.size());
    EXPECT_EQ(PayloadValue(bytes.data()).toValue(), form);
    EXPECT_EQ(PayloadValue(bytes.data()).kind(), form.kind());
    EXPECT_EQ(PayloadValue(bytes.data()).encoded().size(), bytes.size());
  }
}

TEST(MessagePackScanner, RefusesLiesBeforeTheirBytesArrive) {
  const struct {
    const char* name;
    std::string bytes;
    const char* reason;
  } kRows[] = {
      {"list longer than a message", {"\xdd\xff\xff\xff\xff", 5}, "needs"},
      {"dictionary longer than a message", {"\xdf\x00\x00\x02\x01", 5}, "needs"},
      {"dictionary whose doubled count overflows", {"\xdf\xff\xff\xff\xff", 5}, "needs"},
      {"string longer than a message", {"\xdb\x00\x00\x04\x00", 5}, "at most 1024"},
      {"bytes longer than what is left", {"\x92\xa1s\xc5\x03\xff", 6}, "needs"},
      {"extension longer than a message", {"\xc9\x7f\xff\xff\xff\x01", 6}, "needs"},
      {"a byte that is never used", {"\x91\xc1", 2}, "0xc1"},
      {"nested too deep", std::string(5, '\x91'), "deeper than 4"},
      {"nested too deep in dictionaries", "\x81\x01\x81\x01\x81\x01\x81\x01\x81", "deeper than 4"},
  };
  for (const auto& row : kRows) {
    MessagePackScanner scanner(1024, 4);
    EXPECT_EQ(scanner.scan(row.bytes), Progress::fault) << row.name;
    EXPECT_THAT(scanner.fault(), testing::HasSubstr(row.reason)) << row.name;
  }
  MessagePackScanner scanner(1024, 4);
  EXPECT_EQ(scanner.scan("\x91\x91\x91\x90"), Progress::complete) << "at the limit";
}

}  // namespace
}  // namespace quarvel
