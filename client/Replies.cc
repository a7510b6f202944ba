#include "client/Replies.h"

#include <optional>
#include <string>
#include <type_traits>
#include <utility>

namespace quarvel {
namespace {

std::optional<ReporterID> AsReporterID(std::optional<PayloadValue> value) {
  return value ? value->integer() : std::nullopt;
}

std::optional<Client::ServiceType> AsServiceType(std::optional<PayloadValue> value) {
  const auto code = AsReporterID(value);
  if (!code || !std::in_range<std::uint16_t>(*code)) return std::nullopt;
  return static_cast<Client::ServiceType>(*code);
}

// Reads an operation's reply from the service's response; none when it is of another kind.
template <class T>
std::optional<T> Read(PayloadValue result) {
  if constexpr (std::is_same_v<T, bool>) {
    return result.boolean();
  } else if constexpr (std::is_same_v<T, Client::ServiceType>) {
    return AsServiceType(result);
  } else if constexpr (std::is_same_v<T, std::monostate>) {
    return result.isNil() ? std::optional<T>(std::in_place) : std::nullopt;
  } else if constexpr (std::is_same_v<T, Client::Validity>) {
    const auto reporterID = AsReporterID(result.find("reporterID"));
    const auto serviceType = AsServiceType(result.find("serviceType"));
    if (!reporterID || !serviceType) return std::nullopt;
    return Client::Validity{*reporterID, *serviceType};
  } else if constexpr (std::is_same_v<T, std::vector<ReporterID>>) {
    if (result.kind() != PayloadValue::Kind::list) return std::nullopt;
    T reporters;
    reporters.reserve(result.count());
    for (const PayloadValue item : result.items()) {
      const auto reporter = item.integer();
      if (!reporter) return std::nullopt;
      reporters.push_back(*reporter);
    }
    return reporters;
  } else {
    return result.toValue();
  }
}

Error ReadError(PayloadValue error) {
  const auto domain = error.find("domain");
  const auto code = error.find("code");
  const auto userInfo = error.find("userInfo");
  if (!domain || !domain->string() || !code || !code->integer()) {
    return Failure(Client::Code::unexpectedReply, "The service's error has no domain and no code.");
  }
  return {std::string(*domain->string()), *code->integer(),
          userInfo ? userInfo->toDictionary() : Dictionary()};
}

template <class... Cases>
struct Overloaded : Cases... {
  using Cases::operator()...;
};
template <class... Cases>
Overloaded(Cases...) -> Overloaded<Cases...>;

}  // namespace

void DeliverResponse(const AnyReply& reply, PayloadValue error, PayloadValue result) {
  const auto give = [&]<class T>(const Client::Reply<T>& to) {
    if (!error.isNil()) return to(ReadError(error));
    if (auto read = Read<T>(result)) return to(*std::move(read));
    to(Failure(Client::Code::unexpectedReply,
               "The service's reply is not what this operation replies."));
  };
  std::visit(Overloaded{[](std::monostate) {}, give}, reply);
}

void DeliverError(const AnyReply& reply, const Error& error) {
  const auto give = [&error]<class T>(const Client::Reply<T>& to) { to(error); };
  std::visit(Overloaded{[](std::monostate) {}, give}, reply);
}

}  // namespace quarvel
