#pragma once

#include <string>

namespace quarvel {

/// The device as engines know it.
struct ExportDevice {
  std::string name;     // letters, digits, "-" and "_"
  std::string version;  // of the service
};

/// `configured`, or when that is empty the host's name, or when that says nothing an identifier
/// derived from the machine's, which cannot be traced back to it.
[[nodiscard]] ExportDevice DescribeDevice(const std::string& configured);

}  // namespace quarvel
