#include "export/otlp/OtlpSettings.h"

#include <string_view>

namespace quarvel {

namespace {

bool IsHeader(std::string_view name, std::string_view value) {
  return !name.empty() && name.find_first_of(" \t\r\n:") == name.npos &&
         value.find_first_of("\r\n") == value.npos;
}

}  // namespace

std::shared_ptr<const BackendSettings> ReadOtlpSettings(ConfigurationSection& section) {
  auto settings = std::make_shared<OtlpSettings>();
  section.read(
      "endpoint", "an address, \"http://…\" or \"https://…\"",
      [](std::string_view url) {
        return IsUrl(url, {"http", "https"});
      },
      settings->endpoint);
  section.read("headers", "a string without line breaks, for a header's name", IsHeader,
               settings->headers);
  section.read("gzip", settings->gzip);
  ReadTlsSettings(section, settings->tls);
  section.read("connect_seconds", 1, 600, settings->connect);
  section.read("timeout_seconds", 1, 600, settings->timeout);
  ReadGather(section, settings->gather);
  return settings;
}

}  // namespace quarvel
