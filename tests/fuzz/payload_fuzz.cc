// Payloads of any bytes: an accepted payload can be walked, rewritten and written as JSON in both
// forms. RapidJSON must read the payload's values from the JSON, and its tree must write the same.

#include <rapidjson/document.h>

#include <cmath>
#include <string>
#include <string_view>

#include "base/Json.h"
#include "base/MessagePack.h"
#include "base/Payload.h"
#include "tests/fuzz/Require.h"

namespace {

using quarvel::JsonText;
using quarvel::MessagePackScanner;
using quarvel::Payload;
using quarvel::PayloadValue;
using Kind = PayloadValue::Kind;

rapidjson::Document Read(const std::string& json) {
  rapidjson::Document document;
  document.Parse<rapidjson::kParseValidateEncodingFlag | rapidjson::kParseFullPrecisionFlag>(
      json.data(), json.size());
  Require(!document.HasParseError(), "the JSON is JSON");
  return document;
}

bool Says(const rapidjson::Value& json, std::string_view text) {
  return json.IsString() && std::string_view(json.GetString(), json.GetStringLength()) == text;
}

std::string Base64(std::string_view octets) {
  constexpr char kDigits[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  std::string text;
  for (std::size_t at = 0; at < octets.size(); at += 3) {
    const std::string_view group = octets.substr(at, 3);
    std::uint32_t bits = 0;
    for (std::size_t i = 0; i < 3; ++i) {
      bits = bits << 8 | (i < group.size() ? static_cast<unsigned char>(group[i]) : 0U);
    }
    for (std::size_t i = 0; i < 4; ++i) {
      text += i <= group.size() ? kDigits[bits >> (18 - 6 * i) & 63] : '=';
    }
  }
  return text;
}

bool SaysReal(const rapidjson::Value& json, double real) {
  if (std::isnan(real)) return Says(json, "NaN");
  if (std::isinf(real)) return Says(json, real > 0 ? "Infinity" : "-Infinity");
  return json.IsDouble() && json.GetDouble() == real;
}

bool SaysKey(const rapidjson::Value& json, PayloadValue key) {
  if (const auto text = key.string()) return Says(json, *text);
  if (const auto number = key.integer()) return Says(json, std::to_string(*number));
  return Says(json, std::to_string(*key.unsignedInteger()));
}

bool Says(const rapidjson::Value& json, PayloadValue value) {
  switch (value.kind()) {
    case Kind::nil:
      return json.IsNull();
    case Kind::boolean:
      return json.IsBool() && json.GetBool() == *value.boolean();
    case Kind::integer:
      return json.IsInt64() && json.GetInt64() == *value.integer();
    case Kind::unsignedInteger:
      return json.IsUint64() && json.GetUint64() == *value.unsignedInteger();
    case Kind::real:
      return SaysReal(json, *value.real());
    case Kind::string:
      return Says(json, *value.string());
    case Kind::bytes:
      return Says(json, Base64(*value.bytes()));
    case Kind::date:
      return Says(json, quarvel::DateText(*value.date()));
    case Kind::list: {
      bool same = json.IsArray() && json.Size() == value.count();
      rapidjson::SizeType i = 0;
      for (const PayloadValue item : value.items()) same = same && Says(json[i++], item);
      return same;
    }
    case Kind::dictionary: {
      bool same = json.IsObject() && json.MemberCount() == value.count();
      auto member = same ? json.MemberBegin() : rapidjson::Value::ConstMemberIterator();
      for (const auto [key, item] : value.entries()) {
        same = same && SaysKey(member->name, key) && Says(member++->value, item);
      }
      return same;
    }
  }
  return false;
}

void CheckKeys(const Payload& payload, const Payload& rewritten) {
  for (const auto [key, value] : payload) {
    std::string text(key.string().value_or(""));
    for (char& c : text) c = c == ' ' ? '_' : c;
    Require(!key.string() || rewritten.find(text).has_value(), "a rewritten key is there");
  }
  for (const auto [key, value] : rewritten) {
    Require(key.string().value_or("").find(' ') == std::string_view::npos, "no blank is left");
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::string_view bytes(reinterpret_cast<const char*>(data), size);
  MessagePackScanner scanner(1 << 16, 32);
  if (scanner.scan(bytes) != MessagePackScanner::Progress::complete) return 0;
  const PayloadValue value(bytes.data());
  Require(value.encoded().size() == scanner.length(), "the walk ends where the scan does");
  const auto payload = Payload::from(value);
  if (!payload) {
    Require(payload.error().userInfo.find("reason") != nullptr, "a refusal has a reason");
    return 0;
  }
  CheckKeys(payload.value(), payload.value().replacingInKeys(' ', '_'));
  const std::string json = JsonText(payload.value());
  Require(Says(Read(json), payload.value().root()), "the JSON equals the payload");
  quarvel::PrettyJsonWriter pretty;
  pretty.value(payload.value().root());
  const auto text = pretty.finish();
  Require(text.ok() && Says(Read(text.value()), payload.value().root()),
          "the pretty JSON equals the payload");
  const quarvel::Dictionary tree = payload.value().root().toDictionary();
  Require(JsonText(tree) == json && JsonText(Payload(tree)) == json,
          "the JSON of the tree is the same");
  const auto back = quarvel::ValueFromJson(json);
  Require(back.ok(), "the JSON can be read back");
  const std::string once = JsonText(back.value());
  Require(JsonText(quarvel::ValueFromJson(once).value()) == once,
          "a second round trip changes nothing");
  return 0;
}
