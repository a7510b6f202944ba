#include "export/otlp/OtlpEncoding.h"

#include <fmt/format.h>

#include <iterator>

#include "base/Json.h"
#include "base/Vocabulary.h"

namespace quarvel {

namespace {

void AppendAnyValue(std::string& out, const Value& value);

template <class... Arguments>
void Append(std::string& out, fmt::format_string<Arguments...> format, Arguments&&... arguments) {
  fmt::format_to(std::back_inserter(out), format, std::forward<Arguments>(arguments)...);
}

void AppendStringValue(std::string& out, const std::string& text) {
  out += R"({"stringValue":)";
  AppendJson(out, Value(text));
  out += '}';
}

void AppendList(std::string& out, const List& list) {
  out += R"({"arrayValue":{"values":[)";
  for (const Value& item : list) {
    if (&item != &list.front()) out += ',';
    AppendAnyValue(out, item);
  }
  out += "]}}";
}

void AppendDictionary(std::string& out, const Dictionary& dictionary) {
  out += R"({"kvlistValue":{"values":[)";
  bool first = true;
  for (const auto& [key, value] : dictionary) {
    if (!std::exchange(first, false)) out += ',';
    out += R"({"key":)";
    AppendJson(out, Value(*key.string()));  // JSON has only text keys
    out += R"(,"value":)";
    AppendAnyValue(out, value);
    out += '}';
  }
  out += "]}}";
}

/// A value that was read from JSON.
void AppendAnyValue(std::string& out, const Value& value) {
  if (const auto* text = value.string()) {
    AppendStringValue(out, *text);
  } else if (const auto* boolean = value.boolean()) {
    Append(out, R"({{"boolValue":{}}})", *boolean);
  } else if (const auto* integer = value.integer()) {
    Append(out, R"({{"intValue":"{}"}})", *integer);
  } else if (const auto* natural = value.unsignedInteger()) {
    Append(out, R"({{"stringValue":"{}"}})", *natural);
  } else if (value.real() != nullptr) {
    out += R"({"doubleValue":)";
    AppendJson(out, value);
    out += '}';
  } else if (const auto* list = value.list()) {
    AppendList(out, *list);
  } else if (const auto* dictionary = value.dictionary()) {
    AppendDictionary(out, *dictionary);
  } else {
    out += "{}";
  }
}

/// A JSON column, which the service itself has written.
void AppendJsonColumn(std::string& out, const std::string& json) {
  const auto value = ValueFromJson(json);
  if (value) {
    AppendAnyValue(out, value.value());
  } else {
    AppendStringValue(out, json);
  }
}

class Attributes {
 public:
  explicit Attributes(std::string& out) : out_(out) { out_ += R"("attributes":[)"; }
  ~Attributes() { out_ += ']'; }
  Attributes(const Attributes&) = delete;
  Attributes& operator=(const Attributes&) = delete;

  void add(std::string_view key, const Value& value) {
    if (!std::exchange(first_, false)) out_ += ',';
    Append(out_, R"({{"key":"{}","value":)", key);
    AppendAnyValue(out_, value);
    out_ += '}';
  }

 private:
  std::string& out_;
  bool first_ = true;
};

void AddColumn(Attributes& attributes, const ExportColumn& column, const ExportValue& value) {
  const std::string_view name = column.name;
  const std::string key = fmt::format("quarvel.{}", name);
  if (const auto* text = std::get_if<std::string>(&value)) {
    attributes.add(key, *text);
  } else if (const auto* real = std::get_if<double>(&value)) {
    attributes.add(key, *real);
  } else if (const auto* integer = std::get_if<std::int64_t>(&value)) {
    if (column.kind == ExportColumn::Kind::boolean) {
      attributes.add(key, *integer != 0);
    } else if (name == "session_id") {
      attributes.add(key, fmt::to_string(*integer));
    } else {
      attributes.add(key, *integer);
    }
    if (name == "category") {
      const vocabulary::Category category(static_cast<std::uint32_t>(*integer));
      attributes.add("quarvel.category_name", vocabulary::NameOf(category));
    } else if (name == "type") {
      const auto type = static_cast<vocabulary::MessageType>(*integer);
      attributes.add("quarvel.type_name", vocabulary::NameOf(type));
    }
  }
}

void AppendRecord(std::string& out, const ExportBatch& batch, const ExportRow& row) {
  const auto columns = ExportColumns(batch.table);
  out += '{';
  for (std::size_t i = 0; i < columns.size(); ++i) {
    if (columns[i].kind == ExportColumn::Kind::time) {
      const auto* microseconds = std::get_if<std::int64_t>(&row.values[i]);
      Append(out, R"("timeUnixNano":"{}000",)", microseconds == nullptr ? 0 : *microseconds);
    } else if (columns[i].kind == ExportColumn::Kind::json) {
      out += R"("body":)";
      const auto* json = std::get_if<std::string>(&row.values[i]);
      AppendJsonColumn(out, json == nullptr ? "{}" : *json);
      out += ',';
    }
  }
  {
    Attributes attributes(out);
    attributes.add("log.record.uid", batch.nameOf(row));
    attributes.add("quarvel.table", StoreTableName(batch.table));
    for (std::size_t i = 0; i < columns.size(); ++i) {
      if (columns[i].kind == ExportColumn::Kind::json) continue;
      if (columns[i].kind == ExportColumn::Kind::time) continue;
      AddColumn(attributes, columns[i], row.values[i]);
    }
  }
  out += '}';
}

const Value* FindKey(const Value* value, const char* key) {
  return value == nullptr || value->dictionary() == nullptr ? nullptr
                                                            : value->dictionary()->find(key);
}

}  // namespace

std::string OtlpRequest(const ExportBatch& batch, const ExportDevice& device) {
  std::string out = R"({"resourceLogs":[{"resource":{)";
  {
    Attributes attributes(out);
    attributes.add("service.name", "quarveld");
    attributes.add("service.version", device.version);
    attributes.add("service.instance.id", batch.storeID);
    attributes.add("host.name", device.name);
  }
  out += R"(},"scopeLogs":[{"scope":{"name":"tarnwick.quarvel","version":)";
  AppendJson(out, Value(device.version));
  out += R"(},"logRecords":[)";
  for (const ExportRow& row : batch.rows) {
    if (&row != &batch.rows.front()) out += ',';
    AppendRecord(out, batch, row);
  }
  out += "]}]}]}";
  return out;
}

Result<OtlpPartialSuccess> ReadOtlpResponse(std::string_view body) {
  if (body.empty()) return OtlpPartialSuccess{};
  const auto response = ValueFromJson(body);
  if (!response || response.value().dictionary() == nullptr) {
    return Error::because("quarvel.otlp", 1, "The answer is not one of OTLP's in JSON.");
  }
  OtlpPartialSuccess partial;
  const Value* const said = FindKey(&response.value(), "partialSuccess");
  const Value* const rejected = FindKey(said, "rejectedLogRecords");
  if (rejected != nullptr && rejected->string() != nullptr) {
    partial.rejected = std::strtoull(rejected->string()->c_str(), nullptr, 10);
  } else if (rejected != nullptr && rejected->integer() != nullptr && *rejected->integer() > 0) {
    partial.rejected = static_cast<std::size_t>(*rejected->integer());
  }
  const Value* const message = FindKey(said, "errorMessage");
  if (message != nullptr && message->string() != nullptr) partial.message = *message->string();
  return partial;
}

}  // namespace quarvel
