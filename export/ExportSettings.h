#pragma once

#include <chrono>
#include <filesystem>
#include <initializer_list>
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
void ReadTlsSettings(ConfigurationSection& section, TlsSettings& out);

/// Reads `gather_seconds`: how long rows are collected before a batch is sent, one day at most.
void ReadGather(ConfigurationSection& section, std::chrono::seconds& out);

/// Whether `url` is "<scheme>://" and a host, without blanks, a query or a fragment.
[[nodiscard]] bool IsUrl(std::string_view url, std::initializer_list<std::string_view> schemes);

}  // namespace quarvel
