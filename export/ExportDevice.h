#pragma once

#include <string>

namespace quarvel {

/// The identity that engines see of a device. Constant once made.
struct ExportDevice {
  std::string name;     // letters, digits, "-" and "_"
  std::string version;  // of the service
};

/// `configured` as it is, else the host's name with other characters replaced by "-". For an empty
/// name or "localhost" an identifier derived from the machine's, from which the machine's cannot be
/// computed.
[[nodiscard]] std::string DeviceName(const std::string& configured, const std::string& hostName);

/// This device, by `DeviceName`.
[[nodiscard]] ExportDevice DescribeDevice(const std::string& configured);

}  // namespace quarvel
