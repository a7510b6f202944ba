#include "base/Payload.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "base/Json.h"
#include "base/MessagePack.h"
#include "base/Utf8.h"
#include "base/Vocabulary.h"

namespace quarvel {
namespace {

using testing::HasSubstr;

TEST(Payload, RefusesWhatIsNoPayload) {
  const struct {
    const char* name;
    std::string bytes;
    const char* reason;
  } kRows[] = {
      {"no dictionary", {"\x90", 1}, "not a dictionary"},
      {"list as a key", {"\x81\x90\x01", 3}, "neither a string nor an integer"},
      {"boolean as a nested key", {"\x81\xa1k\x81\xc3\x01", 6}, "neither a string nor an integer"},
      {"extension of another type", {"\x81\xa1k\xd4\x05\x00", 6}, "not a timestamp"},
      {"timestamp of an unknown length", {"\x81\xa1k\xd4\xff\x00", 6}, "not a timestamp"},
      {"timestamp with too many nanoseconds",
       {"\x81\xa1k\xd7\xff\xff\xff\xff\xff\x00\x00\x00\x00", 13},
       "not a timestamp"},
      {"timestamp after the year 9999",
       {"\x81\xa1k\xc7\x0c\xff\x00\x00\x00\x00\x7f\xff\xff\xff\xff\xff\xff\xff", 18},
       "not a timestamp"},
      {"stray continuation byte", {"\x81\xa1\x80\x01", 4}, "not UTF-8"},
      {"overlong form", {"\x81\xa1k\xa2\xc0\xaf", 6}, "not UTF-8"},
      {"surrogate", {"\x81\xa1k\xa3\xed\xa0\x80", 7}, "not UTF-8"},
      {"above U+10FFFF", {"\x81\xa1k\xa4\xf4\x90\x80\x80", 8}, "not UTF-8"},
      {"cut off after eight plain bytes",
       {"\x81\xa1k\xaa"
        "12345678\xe2\x82",
        14},
       "not UTF-8"},
  };
  for (const auto& row : kRows) {
    MessagePackScanner scanner(1024, 4);
    ASSERT_EQ(scanner.scan(row.bytes), MessagePackScanner::Progress::complete) << row.name;
    const Result<Payload> payload = Payload::from(PayloadValue(row.bytes.data()));
    ASSERT_FALSE(payload) << row.name;
    EXPECT_THAT(payload.error().description(), HasSubstr(row.reason)) << row.name;
  }
}

TEST(Payload, OfEqualKeysTheLastCounts) {
  // Texts of all lengths, and numbers of which some have the same bits, each twice.
  constexpr std::int64_t kKeys = 3000;
  std::string many;
  MessagePackWriter writer(many);
  writer.dictionary(2 * kKeys);
  for (std::int64_t i = 0; i < 2 * kKeys; ++i) {
    const std::int64_t nth = i % kKeys / 3;
    if (i % 3 == 0)
      writer.string(std::string(static_cast<std::size_t>(nth % 40), 'k') + std::to_string(nth));
    if (i % 3 == 1) writer.integer(-1 - nth);
    if (i % 3 == 2) writer.unsignedInteger(static_cast<std::uint64_t>(-1 - nth));
    writer.integer(i);
  }
  const struct {
    std::string bytes;
    std::string json;
  } kRows[] = {
      {"\x82\xa1"
       "a\x01\xa1"
       "a\x02",
       R"({"a":2})"},
      {"\x83\xa1"
       "a\x01\xa1"
       "b\x02\xa1"
       "a\x03",
       R"({"b":2,"a":3})"},
      {"\x81\xa1"
       "n\x91\x82\xa1"
       "a\x01\xa1"
       "a\x02",
       R"({"n":[{"a":2}]})"},
      {std::string("\x82\x05\x01\xcd\x00\x05\x02", 7), R"({"5":2})"},
      {"\x82\x05\x01\xa1"
       "5\x02",
       R"({"5":1,"5":2})"},
  };
  for (const auto& row : kRows) {
    EXPECT_EQ(JsonText(Payload::from(PayloadValue(row.bytes.data())).value()), row.json);
  }
  const Payload unique = Payload::from(PayloadValue(many.data())).value();
  EXPECT_EQ(unique.count(), kKeys);
  std::int64_t expected = kKeys;
  for (const PayloadEntry& entry : unique) EXPECT_EQ(entry.value.integer(), expected++);
}

TEST(Payload, ReplacesInItsOwnKeysOnly) {
  const Payload plain(Dictionary{{"no_blank", "a b"}, {7, Dictionary{{"in side", 1}}}});
  EXPECT_TRUE(plain.replacingInKeys(' ', '_').sharesBlockWith(plain));
  const Payload blanks(
      Dictionary{{"two words here", 1}, {7, Dictionary{{"in side", 1}}}, {"a b", 2}, {"a_b", 3}});
  EXPECT_EQ(JsonText(blanks.replacingInKeys(' ', '_')),
            R"({"two_words_here":1,"7":{"in side":1},"a_b":3})");
}

TEST(Json, IsReadBackAsWhatItWas) {
  List values;
  for (const double number :
       {0.0, -0.0, 48000.0, -0.5, 0.1 + 0.2, 11.6, 0.0001, -0.00012, 123456.7891, 999999999.9999,
        1e9, 1e15, 1e16, -1e300, 5e-324, std::numeric_limits<double>::max(), 1.0 / 3}) {
    values.emplace_back(number);
  }
  values.emplace_back(std::numeric_limits<std::int64_t>::min());
  // Every character that needs an escape, at every place around the steps of eight.
  for (std::size_t length = 0; length <= 20; ++length) {
    for (std::size_t at = 0; at < length; ++at) {
      for (const char character : {'\0', '\x1f', ' ', '"', '\\', '\x7f', '\n'}) {
        std::string text(length, '!');
        text[at] = character;
        values.emplace_back(std::move(text));
      }
    }
  }
  values.emplace_back(std::string(5000, '"') + "\u20ac\u20ac\u20ac");
  const Result<Value> read = ValueFromJson(JsonText(Value(values)));
  ASSERT_TRUE(read);
  EXPECT_EQ(read.value(), Value(values));
  EXPECT_TRUE(std::signbit(*(*read.value().list())[1].real()));
}

TEST(Json, ComesBackAsATree) {
  const std::string text =
      R"({"a":[1,-2,18446744073709551615,2.5,true,null,{"b":"\u20ac"}],"c":{}})";
  const Result<Value> tree = ValueFromJson(text);
  ASSERT_TRUE(tree);
  EXPECT_EQ(tree.value(), (Dictionary{{"a", List{1, -2, std::numeric_limits<std::uint64_t>::max(),
                                                 2.5, true, nullptr, Dictionary{{"b", "\u20ac"}}}},
                                      {"c", Dictionary{}}}));
  for (const char* bad : {"", "{", "[1,]", "{\"a\":1} x", "\"\xff\"", "nul"}) {
    EXPECT_FALSE(ValueFromJson(bad)) << bad;
  }
  EXPECT_THAT(ValueFromJson(std::string(100'000, '[')).error().description(), HasSubstr("deeper"));
}

TEST(DateText, IsReadAsItIsWritten) {
  for (const char* text : {"0001-01-01T00:00:00.000000Z", "2024-02-29T23:59:59.999999Z",
                           "9999-12-31T23:59:59.999999Z", "1969-12-31T23:59:59.000001Z"}) {
    ASSERT_TRUE(DateFromText(text)) << text;
    EXPECT_EQ(DateText(*DateFromText(text)), text);
  }
  EXPECT_EQ(DateFromText("2026-01-31T14:25:01.1234567+01:00"),
            DateFromText("2026-01-31T13:25:01.123456Z"));
  for (const char* bad :
       {"", "2026-01-31", "2026-02-29T00:00:00Z", "2026-01-31T24:00:00Z", "2026-01-31T00:00:00",
        "2026-01-31T00:00:00.Z", "2026-01-31T00:00:00Z ", "0000-12-31T00:00:00Z"}) {
    EXPECT_FALSE(DateFromText(bad)) << bad;
  }
}

TEST(Vocabulary, NamesAreFixed) {
  using namespace vocabulary;
  const auto names = []<class Code>(Code, std::initializer_list<std::uint32_t> codes) {
    std::string text;
    for (const std::uint32_t code : codes) text.append(NameOf(static_cast<Code>(code))) += ' ';
    return text;
  };
  EXPECT_EQ(names(MessageType{}, {0, 1, 2, 3, 4, 5, 6, 65535}),
            "Generic Start Stop Setup Error IssueDetector Undefined Unknown ");
  EXPECT_EQ(names(ServiceType{}, {0, 1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12, 65535}),
            "generic kivo telephony haptics alarms standalone soundautoconfig longformaudio "
            "nonlongformaudio audiodeviceusage alerts test  unknown ");
  EXPECT_EQ(names(Category{0}, {0, 1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12, 0xffff, 0xffff'ffff}),
            "Undefined Generic Record Playback PlaybackAndRecord Setup ClientRequest RouteChange "
            "Error Tallixing Performance Volume Undefined Undefined Undefined ");
  EXPECT_EQ(names(Category{0}, {0x0800'0003, 0x1000'0003, 0x2000'0003, 0x4000'0003, 0x8000'0000,
                                0x0001'0003, 0xffff'0003}),
            "Session_Playback DSP_Playback HAL_Playback Routing_Playback Toolbox_Undefined "
            "_Playback _Playback ");
  // A code of more than 16 bits is outside the table, also when its low half is not.
  EXPECT_EQ(TypeName(0x1'0001), "Undefined");
  EXPECT_EQ(ServiceTypeName(0x1'0001), "");
}

TEST(Dictionary, ALargeOneKeepsOrderAndReplacesInPlace) {
  Dictionary dictionary;
  for (int round = 0; round < 2; ++round) {
    for (int i = 0; i < 50; ++i) dictionary.set("key " + std::to_string(i), i + 100 * round);
  }
  EXPECT_EQ(dictionary.size(), 50);
  int expected = 100;
  for (const auto& [key, value] : dictionary) EXPECT_EQ(value, Value(expected++));
  EXPECT_EQ(dictionary.find("key 50"), nullptr);
}

}  // namespace
}  // namespace quarvel
