#include "export/ExportSettings.h"

#include <fmt/format.h>
#include <systemd/sd-id128.h>
#include <unistd.h>

#include <array>
#include <cctype>

namespace quarvel {

namespace {

// A random constant: the identifier derived with it is the service's own.
constexpr sd_id128_t kApplication{.bytes = {0x7b, 0x0c, 0x5e, 0x42, 0x91, 0xd3, 0x4f, 0x1a, 0xa6,
                                            0x08, 0x2e, 0xc7, 0x13, 0x5d, 0xf0, 0x69}};

/// Replaces the characters that subjects and labels may not hold.
std::string CleanName(std::string name) {
  for (char& character : name) {
    const auto octet = static_cast<unsigned char>(character);
    if (octet > 127 || (std::isalnum(octet) == 0 && character != '_')) character = '-';
  }
  return name;
}

std::string HostName() {
  std::array<char, 256> name{};
  return ::gethostname(name.data(), name.size() - 1) == 0 ? name.data() : "";
}

std::string MachineName() {
  sd_id128_t identifier{};
  if (sd_id128_get_machine_app_specific(kApplication, &identifier) < 0) return "unnamed";
  std::array<char, SD_ID128_STRING_MAX> text{};
  return sd_id128_to_string(identifier, text.data());
}

}  // namespace

void ReadTlsSettings(ConfigurationSection& section, TlsSettings& out) {
  section.read("tls_ca", out.authority);
  section.read("tls_certificate", out.certificate);
  section.read("tls_key", out.key);
  section.require("tls_key", !out.key.empty() || out.certificate.empty());
  section.require("tls_certificate", !out.certificate.empty() || out.key.empty());
}

void ReadGather(ConfigurationSection& section, std::chrono::seconds& out) {
  section.read("gather_seconds", 0, std::chrono::seconds(std::chrono::days(1)).count(), out);
}

bool IsUrl(std::string_view url, std::initializer_list<std::string_view> schemes) {
  for (const std::string_view scheme : schemes) {
    if (!url.starts_with(scheme) || !url.substr(scheme.size()).starts_with("://")) continue;
    const std::string_view rest = url.substr(scheme.size() + 3);
    return !rest.empty() && rest.front() != '/' && rest.find_first_of(" \t\r\n?#") == url.npos;
  }
  return false;
}

std::string DeviceName(const std::string& configured, const std::string& hostName) {
  std::string name = configured.empty() ? CleanName(hostName) : configured;
  if (name.empty() || name == "localhost") name = MachineName();
  return name;
}

ExportDevice DescribeDevice(const std::string& configured) {
  return {DeviceName(configured, HostName()), QUARVEL_VERSION};
}

}  // namespace quarvel
