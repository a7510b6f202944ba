#pragma once

#include <concepts>
#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <tuple>
#include <utility>
#include <vector>

#include "base/Payload.h"
#include "base/Value.h"
#include "platform/Reply.h"

namespace quarvel {

/// An object whose operations a connection's client may call. Shared by its connection, which
/// releases it when it is invalidated; called on the connection's thread.
class ExportedObject {
 public:
  virtual ~ExportedObject() = default;
};

/// One operation: turns a call's arguments, as they came over the wire, into a typed call.
struct ExportedMethod {
  /// Checks the arguments and, when they fit, calls the operation on `object`, which must be of the
  /// interface's class. When they do not fit, returns a sentence that names the fault.
  using Invoke = std::optional<std::string> (*)(const ExportedMethod& method,
                                                ExportedObject& object,
                                                std::span<const PayloadValue> arguments,
                                                std::shared_ptr<ReplySink> reply);

  std::string_view name;      // the full keyword name, "setConfiguration:forReporterID:reply:"
  std::size_t argumentCount;  // without the reply
  Invoke invoke;

  /// The keyword in front of argument `index`.
  [[nodiscard]] std::string_view keyword(std::size_t index) const;
};

/// A protocol that can be exported: its name and its operations. Lives as long as the process.
struct ExportedInterface {
  std::string_view name;
  std::span<const ExportedMethod> methods;

  /// Null when there is no such operation.
  [[nodiscard]] const ExportedMethod* find(std::string_view method) const;
};

/// Reads one argument of type `T`. `decode` returns false when the value does not fit `expected`, a
/// noun phrase for the client, and sets `fault` where it can be more precise.
template <class T>
struct ExportedArgument;

/// An integer of either sign in the value that fits the parameter's width.
template <IntegerNumber Integer>
struct ExportedArgument<Integer> {
  static bool decode(PayloadValue value, Integer& out, std::string& /*fault*/) {
    const auto takeIfItFits = [&out](auto integer) {
      if (!integer || !std::in_range<Integer>(*integer)) return false;
      out = static_cast<Integer>(*integer);
      return true;
    };
    return takeIfItFits(value.integer()) || takeIfItFits(value.unsignedInteger());
  }
  static std::string expected() {
    return std::string(std::is_signed_v<Integer> ? "a signed " : "an unsigned ") +
           std::to_string(sizeof(Integer) * 8) + "-bit integer";
  }
};

/// A dictionary that stays encoded; nil for none.
template <>
struct ExportedArgument<std::optional<Payload>> {
  static bool decode(PayloadValue value, std::optional<Payload>& out, std::string& fault);
  static std::string expected();
};

/// A dictionary as a tree of values; nil for none.
template <>
struct ExportedArgument<std::optional<Dictionary>> {
  static bool decode(PayloadValue value, std::optional<Dictionary>& out, std::string& fault);
  static std::string expected();
};

/// A list of signed 64-bit integers; nil for none.
template <>
struct ExportedArgument<std::optional<std::vector<std::int64_t>>> {
  static bool decode(PayloadValue value, std::optional<std::vector<std::int64_t>>& out,
                     std::string& fault);
  static std::string expected();
};

/// Sentences for arguments that do not fit; clients read them.
[[nodiscard]] std::string WrongArgumentCount(const ExportedMethod& method, std::size_t given);
[[nodiscard]] std::string WrongArgument(const ExportedMethod& method, std::size_t index,
                                        std::string_view expected, std::string_view fault);

/// Implements `ExportedMethod` for one member function of an exported class.
template <auto Operation>
struct ExportedOperation;

template <class Object, class... Parameters, void (Object::*Operation)(Parameters...)>
struct ExportedOperation<Operation> {
  static_assert(std::derived_from<Object, ExportedObject>);
  static constexpr std::size_t kArguments = sizeof...(Parameters) - 1;
  using Values = std::tuple<std::remove_cvref_t<Parameters>...>;

  static std::optional<std::string> invoke(const ExportedMethod& method, ExportedObject& object,
                                           std::span<const PayloadValue> arguments,
                                           std::shared_ptr<ReplySink> reply) {
    if (arguments.size() != kArguments) return WrongArgumentCount(method, arguments.size());
    Values values;
    std::optional<std::string> wrong;
    decode(method, arguments, values, wrong, std::make_index_sequence<kArguments>{});
    if (wrong) return wrong;
    using ReplyType = std::tuple_element_t<kArguments, Values>;
    std::get<kArguments>(values) = ReplyType(std::move(reply));
    std::apply(
        [&object](auto&&... value) {
          (static_cast<Object&>(object).*Operation)(std::forward<decltype(value)>(value)...);
        },
        std::move(values));
    return std::nullopt;
  }

 private:
  // Decodes in order and stops at the first argument that does not fit.
  template <std::size_t... Index>
  static void decode(const ExportedMethod& method, std::span<const PayloadValue> arguments,
                     Values& values, std::optional<std::string>& wrong,
                     std::index_sequence<Index...>) {
    [[maybe_unused]] const auto decodeOne = [&]<class T>(std::size_t index, T& out) {
      std::string fault;
      if (ExportedArgument<T>::decode(arguments[index], out, fault)) return true;
      wrong = WrongArgument(method, index, ExportedArgument<T>::expected(), fault);
      return false;
    };
    (void)(decodeOne(Index, std::get<Index>(values)) && ...);
  }
};

/// Describes one operation: a member function of the exported class whose last parameter is its
/// reply. `name` is a string literal.
template <auto Operation>
constexpr ExportedMethod Exported(std::string_view name) {
  return {name, ExportedOperation<Operation>::kArguments, &ExportedOperation<Operation>::invoke};
}

}  // namespace quarvel
