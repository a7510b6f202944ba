#include <fmt/format.h>
#include <gmock/gmock.h>
#include <sys/stat.h>

#include <cmath>
#include <fstream>

#include "base/Files.h"
#include "base/Json.h"
#include "base/MessagePack.h"
#include "base/Payload.h"
#include "base/Vocabulary.h"
#include "tests/TemporaryDirectory.h"

namespace quarvel {
namespace {

namespace fs = std::filesystem;
using testing::HasSubstr;
using Progress = MessagePackScanner::Progress;

struct Fault {
  const char* name;
  std::string bytes;
  const char* reason;
};

List EveryForm() {
  List forms{nullptr, true, false, Value(1.5), Value(-0.0), Bytes{"\x00\xff"}, "text"};
  for (const int bits : {5, 7, 8, 15, 16, 31, 32, 62, 63}) {
    const std::uint64_t edge = std::uint64_t{1} << bits;
    forms.insert(forms.end(), {edge - 1, edge, -static_cast<std::int64_t>(edge - 1) - 1,
                               -static_cast<std::int64_t>(edge - 1)});
  }
  forms.emplace_back(UINT64_MAX);
  for (const std::size_t length : {0U, 31U, 32U, 255U, 256U, 65'535U, 65'536U}) {
    forms.emplace_back(std::string(length, 's'));
    forms.emplace_back(Bytes{std::string(length, 'b')});
  }
  for (const std::size_t count : {15U, 16U, 65'536U}) forms.emplace_back(List(count, Value(1)));
  Dictionary large{{7, "seven"}, {-7, "minus seven"}, {"7", "text"}};
  for (int i = 0; i < 70'000; ++i) large.set(i, i);
  forms.emplace_back(std::move(large));
  for (const std::int64_t microseconds :
       {0L, 1L, -1L, 1'769'865'901'123'456L, 4'294'967'296'000'000L, 17'179'869'184'000'000L}) {
    forms.emplace_back(Date(std::chrono::microseconds(microseconds)));
  }
  forms.insert(forms.end(), {kEarliestDate, kLatestDate});
  return forms;
}

TEST(MessagePack, EveryFormComesBackAsItWasWritten) {
  for (const Value& form : EveryForm()) {
    std::string bytes;
    MessagePackWriter(bytes).value(form);
    MessagePackScanner scanner(bytes.size(), 4);
    ASSERT_EQ(scanner.scan(bytes), Progress::complete) << scanner.fault();
    EXPECT_EQ(scanner.length(), bytes.size());
    const PayloadValue read(bytes.data());
    EXPECT_EQ(read.toValue(), form);
    EXPECT_EQ(read.kind(), form.kind());
    EXPECT_EQ(read.encoded().size(), bytes.size());
  }
}

TEST(MessagePackScanner, RefusesLiesBeforeTheirBytesArrive) {
  const Fault kRows[] = {
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
    EXPECT_THAT(scanner.fault(), HasSubstr(row.reason)) << row.name;
  }
  MessagePackScanner scanner(1024, 4);
  EXPECT_EQ(scanner.scan("\x91\x91\x91\x90"), Progress::complete) << "at the limit";
}

TEST(Payload, RefusesWhatIsNoPayload) {
  const Fault kRows[] = {
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
      {"cut off after eight plain bytes", {"\x81\xa1k\xaaplainly \xe2\x82", 14}, "not UTF-8"},
  };
  for (const auto& row : kRows) {
    MessagePackScanner scanner(1024, 4);
    ASSERT_EQ(scanner.scan(row.bytes), Progress::complete) << row.name;
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
    if (i % 3 == 0) writer.string(fmt::format("{:k>{}}", nth, nth % 40 + 1));
    if (i % 3 == 1) writer.integer(-1 - nth);
    if (i % 3 == 2) writer.unsignedInteger(static_cast<std::uint64_t>(-1 - nth));
    writer.integer(i);
  }
  const std::pair<std::string, std::string> rows[] = {
      {"\x82\xa1k\x01\xa1k\x02", R"({"k":2})"},
      {"\x83\xa1k\x01\xa1m\x02\xa1k\x03", R"({"m":2,"k":3})"},
      {"\x81\xa1n\x91\x82\xa1k\x01\xa1k\x02", R"({"n":[{"k":2}]})"},
      {std::string("\x82\x05\x01\xcd\x00\x05\x02", 7), R"({"5":2})"},
      {"\x82\x05\x01\xa1\x35\x02", R"({"5":1,"5":2})"},
  };
  for (const auto& [bytes, json] : rows) {
    EXPECT_EQ(JsonText(Payload::from(PayloadValue(bytes.data())).value()), json);
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
  values.emplace_back(INT64_MIN);
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

TEST(Json, IsReadAsATree) {
  EXPECT_EQ(
      ValueFromJson(R"({"a":[1,-2,18446744073709551615,2.5,true,null,{"b":"\u20ac"}],"c":{}})")
          .value(),
      (Dictionary{{"a", List{1, -2, UINT64_MAX, 2.5, true, nullptr, Dictionary{{"b", "€"}}}},
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
  for (int i = 0; i < 100; ++i) dictionary.set(fmt::format("key {}", i % 50), i + 50);
  EXPECT_EQ(dictionary.size(), 50);
  int expected = 100;
  for (const auto& [key, value] : dictionary) EXPECT_EQ(value, Value(expected++));
  EXPECT_EQ(dictionary.find("key 50"), nullptr);
}

/// The code of a failure; 0 for success.
template <class T>
std::int64_t CodeOf(const Result<T>& result) {
  return result ? 0 : result.error().code;
}

TEST(FilesTest, DirectoriesAreMadeWithTheirPermissions) {
  const TemporaryDirectory directory;
  const mode_t mask = umask(077);
  for (const char* path : {"a/b/c", "a/b/d/"}) {
    const fs::path made = directory.path() / path;
    ASSERT_TRUE(MakeDirectory(made.native(), 0777).ok());
    EXPECT_EQ(fs::status(made).permissions(), fs::perms::all);
  }
  EXPECT_EQ(fs::status(directory.path() / "a/b").permissions(), fs::perms::owner_all);
  umask(mask);
  // One that exists stays as it is.
  ASSERT_TRUE(MakeDirectory((directory.path() / "a/b").native(), 0777).ok());
  EXPECT_EQ(fs::status(directory.path() / "a/b").permissions(), fs::perms::owner_all);
  const fs::path file = directory.write("file", "");
  for (const fs::path& path : {file, file / "below"}) {
    EXPECT_EQ(CodeOf(MakeDirectory(path.native(), 0777)), ENOTDIR) << path;
  }
}

TEST(FilesTest, AFileIsReplacedAsAWholeAndAReaderOfTheOldOneReadsOn) {
  const TemporaryDirectory directory;
  const fs::path file = directory.write("history.json", "old");
  const fs::path link = directory.path() / "link";
  fs::create_symlink(file, link);
  fs::permissions(file, fs::perms::owner_read | fs::perms::group_read);
  std::ifstream reader(file);
  ASSERT_TRUE(RewriteFile(link, "rewritten", 0644).ok());
  EXPECT_EQ(fs::status(file).permissions(), fs::perms::owner_read | fs::perms::group_read);
  EXPECT_TRUE(fs::is_symlink(link));
  ASSERT_TRUE(ReplaceFile(file.native(), "new", 0600).ok());
  EXPECT_EQ(fs::status(file).permissions(), fs::perms::owner_read | fs::perms::owner_write);
  EXPECT_EQ(std::string(std::istreambuf_iterator<char>(reader), {}), "old");
  EXPECT_EQ(ReadWholeFile(link).value(), "new");
}

TEST(FilesTest, AWholeFileIsReadUpToItsBoundAndNeverWaitedFor) {
  const TemporaryDirectory directory;
  const std::string text(20'000, 'x');
  const fs::path file = directory.write("file", text);
  const fs::path fifo = directory.path() / "fifo";
  ASSERT_EQ(::mkfifo(fifo.c_str(), 0600), 0);
  EXPECT_EQ(ReadWholeFile(file, text.size()).value(), text);
  EXPECT_EQ(ReadWholeFile(fifo).value(), "");
  const std::pair<fs::path, int> failures[] = {
      {file, EFBIG}, {directory.path(), EISDIR}, {file / "below", ENOTDIR}, {"absent", ENOENT}};
  for (const auto& [path, status] : failures) {
    EXPECT_EQ(CodeOf(ReadWholeFile(path, text.size() - 1)), status) << path;
  }
}

TEST(FilesTest, WritingThatFailsLeavesNothingBehind) {
  const TemporaryDirectory directory;
  const Outcome missing = ReplaceFile((directory.path() / "no/file").native(), "x");
  ASSERT_EQ(CodeOf(missing), ENOENT);
  EXPECT_THAT(missing.error().description(), HasSubstr("no/file"));
  const fs::path taken = directory.path() / "taken";
  fs::create_directories(taken / "by-a-folder");
  EXPECT_FALSE(ReplaceFile((taken / "by-a-folder").native(), "x").ok());
  EXPECT_EQ(std::distance(fs::directory_iterator(taken), {}), 1);
}

}  // namespace
}  // namespace quarvel
