#pragma once

#include <array>
#include <filesystem>
#include <optional>
#include <string_view>

#include "device/DirectoryWatch.h"
#include "device/OrientationCenter.h"

namespace quarvel {

/// Orientations from the files device-orientation and ui-orientation of a directory. A file holds
/// an orientation's name or number. A missing file means an unknown orientation at the start and no
/// change later; a file that holds something else is logged and changes nothing.
/// `watch` must be destroyed first.
class OrientationFiles final : public OrientationSource {
 public:
  OrientationFiles(OrientationCenter& center, std::filesystem::path directory,
                   DirectoryWatch& watch);

  std::optional<Orientation> begin(OrientationKind kind) override;
  void end(OrientationKind kind) override;

 private:
  [[nodiscard]] std::optional<Orientation> read(OrientationKind kind) const;
  void written(std::string_view file);

  OrientationCenter& center_;
  const std::filesystem::path directory_;
  DirectoryWatch& watch_;
  bool watching_ = false;  // touched under the center's lock only
};

/// "portrait" or "1", blanks around it allowed. None for anything else.
[[nodiscard]] std::optional<Orientation> OrientationFromText(std::string_view text);

}  // namespace quarvel
