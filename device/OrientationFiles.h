#pragma once

#include <array>
#include <filesystem>
#include <optional>
#include <string_view>

#include "device/DirectoryWatch.h"
#include "device/OrientationCenter.h"

namespace quarvel {

/// Reads orientations from the files device-orientation and ui-orientation of a directory. A file
/// holds an orientation's name or number. A missing file means an unknown orientation at the start
/// and no change later. Any other content is logged and changes nothing.
///
/// Owned by the center. Reads on the thread of `watch`, which must be destroyed first, and on the
/// thread that registers the first handler.
class OrientationFiles final : public OrientationSource {
 public:
  /// Watches nothing yet. `center` owns this; `directory` holds both files and is made when
  /// missing.
  OrientationFiles(OrientationCenter& center, std::filesystem::path directory,
                   DirectoryWatch& watch);

  /// Watches the directory from the first call on, then reads the file of `kind`.
  std::optional<Orientation> start(OrientationKind kind) override;
  /// Goes on watching, since a watch costs nothing while no file changes.
  void stop(OrientationKind kind) override;

 private:
  /// None when the file is missing or, after a log line, wrong.
  [[nodiscard]] std::optional<Orientation> read(OrientationKind kind) const;
  /// Reports the orientation in a file that was written; an empty name stands for both files.
  void reportWritten(std::string_view file);

  OrientationCenter& center_;
  const std::filesystem::path directory_;
  DirectoryWatch& watch_;
  bool watching_ = false;  // guarded by the center's lock
};

/// The orientation with this name ("portrait") or number ("1"), blanks around it allowed; else
/// none.
[[nodiscard]] std::optional<Orientation> OrientationFromText(std::string_view text);

}  // namespace quarvel
