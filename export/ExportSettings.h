#pragma once

#include <chrono>
#include <filesystem>
#include <initializer_list>
#include <string>
#include <string_view>

#include "system/ConfigurationSection.h"

namespace quarvel {

// Settings that the sections of several engines have in common. Read on the thread that reads the
// configuration; constant afterwards.

/// Files in PEM. Empty: the system's authorities, and no certificate of the device's own.
struct TlsSettings {
  std::filesystem::path authority, certificate, key;
};

/// Reads `tls_ca`, `tls_certificate` and `tls_key`; the last two come together or not at all.
/// Whether the files exist is found when the engine connects.
void ReadTlsSettings(ConfigurationSection& section, TlsSettings& out);

/// Reads `gather_seconds`: how long rows are collected before a batch is sent, one day at most.
void ReadGather(ConfigurationSection& section, std::chrono::seconds& out);

/// For address keys: whether `url` is "<scheme>://" and a host, without blanks, a query or a
/// fragment.
[[nodiscard]] bool IsUrl(std::string_view url, std::initializer_list<std::string_view> schemes);

/// The identity that engines see of a device. Constant once made.
struct ExportDevice {
  std::string name;     // letters, digits, "-" and "_"
  std::string version;  // of the service, as the build set it
};

/// `configured` as it is, else the host's name with other characters replaced by "-". For an empty
/// name or "localhost" an identifier derived from the machine's, from which the machine's cannot be
/// computed.
[[nodiscard]] std::string DeviceName(const std::string& configured, const std::string& hostName);

/// This device, by `DeviceName`.
/// Reads the host's name and the machine's identifier; called once, when the engines are made.
[[nodiscard]] ExportDevice DescribeDevice(const std::string& configured);

}  // namespace quarvel
