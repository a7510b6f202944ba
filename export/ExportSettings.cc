#include "export/ExportSettings.h"

namespace quarvel {

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

}  // namespace quarvel
