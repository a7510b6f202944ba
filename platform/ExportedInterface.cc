#include "platform/ExportedInterface.h"

#include <fmt/format.h>

#include <algorithm>

namespace quarvel {

std::string_view ExportedMethod::keyword(std::size_t index) const {
  std::string_view rest = name;
  for (; index > 0; --index) rest.remove_prefix(std::min(rest.find(':') + 1, rest.size()));
  return rest.substr(0, rest.find(':'));
}

const ExportedMethod* ExportedInterface::find(std::string_view method) const {
  const auto found = std::ranges::find(methods, method, &ExportedMethod::name);
  return found == methods.end() ? nullptr : &*found;
}

std::string WrongArgumentCount(const ExportedMethod& method, std::size_t given) {
  return fmt::format("{} takes {} argument{}, but {} came.", method.name, method.argumentCount,
                     method.argumentCount == 1 ? "" : "s", given);
}

std::string WrongArgument(const ExportedMethod& method, std::size_t index,
                          std::string_view expected, std::string_view fault) {
  return fmt::format("Argument {} ({}) of {} must be {}{}{}.", index + 1, method.keyword(index),
                     method.name, expected, fault.empty() ? "" : ": ", fault);
}

namespace {

bool decodePayload(PayloadValue value, std::optional<Payload>& out, std::string& fault) {
  if (value.isNil()) {
    out.reset();
    return true;
  }
  if (value.kind() != PayloadValue::Kind::dictionary) return false;
  Result<Payload> payload = Payload::from(value);
  if (!payload) {
    fault = payload.error().description();
    if (const Value* reason = payload.error().userInfo.find("reason")) fault = *reason->string();
    return false;
  }
  out = std::move(payload.value());
  return true;
}

constexpr const char* kDictionaryExpected =
    "a dictionary with string or integer keys, or nil for none";

}  // namespace

bool ExportedArgument<std::optional<Payload>>::decode(PayloadValue value,
                                                      std::optional<Payload>& out,
                                                      std::string& fault) {
  return decodePayload(value, out, fault);
}

std::string ExportedArgument<std::optional<Payload>>::expected() {
  return kDictionaryExpected;
}

bool ExportedArgument<std::optional<Dictionary>>::decode(PayloadValue value,
                                                         std::optional<Dictionary>& out,
                                                         std::string& fault) {
  std::optional<Payload> payload;
  if (!decodePayload(value, payload, fault)) return false;
  if (payload) {
    out = payload->root().toDictionary();
  } else {
    out.reset();
  }
  return true;
}

std::string ExportedArgument<std::optional<Dictionary>>::expected() {
  return kDictionaryExpected;
}

bool ExportedArgument<std::optional<std::vector<std::int64_t>>>::decode(
    PayloadValue value, std::optional<std::vector<std::int64_t>>& out, std::string& fault) {
  out.reset();
  if (value.isNil()) return true;
  if (value.kind() != PayloadValue::Kind::list) return false;
  out.emplace().reserve(value.count());
  for (const PayloadValue item : value.items()) {
    std::int64_t reporterID = 0;
    if (!ExportedArgument<std::int64_t>::decode(item, reporterID, fault)) {
      fault = fmt::format("item {} is not {}", out->size() + 1,
                          ExportedArgument<std::int64_t>::expected());
      return false;
    }
    out->push_back(reporterID);
  }
  return true;
}

std::string ExportedArgument<std::optional<std::vector<std::int64_t>>>::expected() {
  return "a list of signed 64-bit integers, or nil for none";
}

}  // namespace quarvel
