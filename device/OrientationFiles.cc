#include "device/OrientationFiles.h"

#include <string>
#include <string_view>
#include <system_error>
#include <utility>

#include "base/Files.h"
#include "device/CounterFile.h"
#include "platform/Log.h"

namespace quarvel {

namespace {

constexpr std::array<std::string_view, kOrientationKinds> kFileNames{"device-orientation",
                                                                     "ui-orientation"};

std::string_view fileName(OrientationKind kind) {
  return kFileNames[static_cast<std::size_t>(kind)];
}

}  // namespace

std::optional<Orientation> OrientationFromText(std::string_view text) {
  text = TrimBlanks(text);
  for (std::int32_t number = 0; number <= static_cast<std::int32_t>(Orientation::faceDown);
       ++number) {
    const auto orientation = static_cast<Orientation>(number);
    if (text == std::to_string(number) || text == OrientationName(orientation)) {
      return orientation;
    }
  }
  return std::nullopt;
}

OrientationFiles::OrientationFiles(OrientationCenter& center, std::filesystem::path directory,
                                   DirectoryWatch& watch)
    : center_(center), directory_(std::move(directory)), watch_(watch) {}

std::optional<Orientation> OrientationFiles::start(OrientationKind kind) {
  ZQ_FUNCTION("OrientationFiles");
  if (!watching_) {
    const int status =
        watch_.add(directory_, [this](std::string_view file) { reportWritten(file); });
    if (status != 0) {
      ZQ_LOG(nullptr, error, "no orientation, {} cannot be watched: {}", directory_.native(),
             std::generic_category().message(status));
      return std::nullopt;
    }
    watching_ = true;
  }
  return read(kind).value_or(Orientation::unknown);
}

// The watch stays: it costs nothing while no file is written.
void OrientationFiles::stop(OrientationKind) {}

std::optional<Orientation> OrientationFiles::read(OrientationKind kind) const {
  ZQ_FUNCTION("OrientationFiles");
  const std::filesystem::path file = directory_ / fileName(kind);
  const auto content = ReadWholeFile(file);
  if (!content) return std::nullopt;
  const std::string_view text = std::string_view(content.value()).substr(0, 64);
  const auto orientation = OrientationFromText(text);
  if (!orientation) {
    ZQ_LOG(nullptr, error, "{} holds \"{}\", which is no orientation", file.native(), text);
  }
  return orientation;
}

void OrientationFiles::reportWritten(std::string_view file) {
  for (const OrientationKind kind : {OrientationKind::device, OrientationKind::ui}) {
    if (!file.empty() && file != fileName(kind)) continue;
    if (const auto orientation = read(kind)) center_.reportChange(kind, *orientation);
  }
}

}  // namespace quarvel
