#pragma once

#include <cstdint>
#include <string>
#include <string_view>

/// The codes that messages and sessions carry, and the service's names for them: the one table that
/// the service, its clients and its exporters share. Functions may be called from any thread.
namespace quarvel::vocabulary {

/// The high half of a category: the part of the system that produced the message.
enum class Component : std::uint32_t {
  none = 0,  // the name is the kind's alone
  session = 0x0800'0000,
  dsp = 0x1000'0000,
  hal = 0x2000'0000,
  routing = 0x4000'0000,
  toolbox = 0x8000'0000,
};

/// The low half of a category: the subject of the message.
enum class Kind : std::uint16_t {
  generic = 1,
  record,
  playback,
  playbackAndRecord,
  setup,
  clientRequest,
  routeChange,
  error,
  tallixing,
  performance,
  volume,
};

/// A message's category. Codes outside the two tables are allowed and keep their number.
struct Category {
  std::uint32_t code;  // component in the high 16 bits, kind in the low 16

  /// Any number, as a client has sent it.
  constexpr explicit Category(std::uint32_t number) : code(number) {}
  constexpr Category(Kind kind)  // NOLINT(google-explicit-constructor): a kind alone is a category
      : code(static_cast<std::uint32_t>(kind)) {}
  /// The kind of a component.
  constexpr Category(Component component, Kind kind)
      : code(static_cast<std::uint32_t>(component) | static_cast<std::uint32_t>(kind)) {}
  constexpr bool operator==(const Category&) const = default;
};

/// A message's type. Every 16-bit code is allowed.
enum class MessageType : std::uint16_t {
  generic = 0,
  start = 1,  // the subject has begun
  stop = 2,   // the subject has ended
  setup = 3,
  error = 4,
  issueDetector = 5,  // found by a detector of faults
  unknown = 65535,
};

/// The purpose of a session's audio. Codes outside the table are allowed but have no name.
enum class ServiceType : std::uint16_t {
  generic = 0,
  kivo = 1,
  telephony = 2,
  haptics = 3,
  alarms = 4,
  standalone = 5,
  soundAutoConfig = 6,
  longFormAudio = 7,
  nonLongFormAudio = 8,
  audioDeviceUsage = 9,
  alerts = 10,
  test = 11,        // messages of such a session are counted and go to no backend
  unknown = 65535,  // also the type of a session that the service does not know
};

/// The composed name: "HAL_Playback", "Playback" without a component, "_Generic" with an unknown
/// one, "Undefined" for an unknown kind. The code 0xffffffff names no component.
[[nodiscard]] std::string NameOf(Category category);
/// "Start", or "Undefined" for a code outside the table.
[[nodiscard]] std::string_view NameOf(MessageType type);
/// "telephony", or the empty text for a code outside the table.
[[nodiscard]] std::string_view NameOf(ServiceType serviceType);

/// A category's name in its constant pieces: the component with its "_", empty when there is none,
/// and the kind. Two categories have one name when both pieces are equal.
struct CategoryName {
  std::string_view component;
  std::string_view kind;
};
/// Allocates nothing: both views are of constant texts.
[[nodiscard]] CategoryName PiecesOf(Category category);

/// The names of codes that may be wider than 16 bits: such a code is outside the table. They are
/// "Undefined" for a type and the empty text for a service type. Valid for ever.
[[nodiscard]] std::string_view TypeName(std::uint32_t code);
[[nodiscard]] std::string_view ServiceTypeName(std::uint32_t code);

}  // namespace quarvel::vocabulary
