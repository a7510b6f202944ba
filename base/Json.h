#pragma once

#include <memory>
#include <string>
#include <string_view>

#include "base/Error.h"
#include "base/Payload.h"
#include "base/Value.h"

namespace quarvel {

// JSON has fewer kinds of values than MessagePack. Dates are written as RFC 3339 text with
// microseconds, bytes as base64 text, non-finite numbers as "NaN", "Infinity" and "-Infinity".
// Integer keys become their decimal text. Keys keep their order.

/// Appends compact JSON, and leaves the text before it as it is. A `PayloadValue` must be part of a
/// `Payload`.
void AppendJson(std::string& out, PayloadValue value);
void AppendJson(std::string& out, const Value& value);
void AppendJson(std::string& out, const Dictionary& dictionary);

/// Compact JSON: no blanks, no line ends. Strings must be UTF-8, which is not checked here. May be
/// called from any thread.
[[nodiscard]] std::string JsonText(const Payload& payload);
[[nodiscard]] std::string JsonText(const Value& value);
[[nodiscard]] std::string JsonText(const Dictionary& dictionary);

/// Writes one JSON text for people to read, piece by piece, indented by four blanks a level. One
/// thread at a time; spent after `finish`.
class PrettyJsonWriter {
 public:
  PrettyJsonWriter();
  ~PrettyJsonWriter();
  PrettyJsonWriter(const PrettyJsonWriter&) = delete;
  PrettyJsonWriter& operator=(const PrettyJsonWriter&) = delete;

  // Containers are closed in the reverse order of their opening; that is not checked.
  void beginList();
  void endList();
  void beginDictionary();
  void endDictionary();
  /// In a dictionary, before each value or `begin`.
  void key(std::string_view key);
  // A whole value, with all that it holds; a `PayloadValue` as for `AppendJson`.
  void value(PayloadValue value);
  void value(const Dictionary& dictionary);
  /// The whole text, after the last `end`. Errors: domain "quarvel.json", when a string was not
  /// UTF-8.
  [[nodiscard]] Result<std::string> finish();

 private:
  struct Implementation;  // the JSON library's writer, which no header names
  std::unique_ptr<Implementation> implementation_;
};

/// Reads one JSON text, nested at most `MessagePackScanner::kDeepest` deep. A number without a
/// fraction or exponent becomes an integer when it fits 64 bits. Errors: domain "quarvel.json"; the
/// reason names the offset.
[[nodiscard]] Result<Value> ValueFromJson(std::string_view text);

}  // namespace quarvel
