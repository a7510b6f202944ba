#include "export/nats/NatsSettings.h"

#include <string_view>

namespace quarvel {

std::shared_ptr<const BackendSettings> ReadNatsSettings(ConfigurationSection& section) {
  auto settings = std::make_shared<NatsSettings>();
  section.read(
      "urls", "a list of addresses, each \"nats://…\" or \"tls://…\", none twice",
      [](std::string_view url) {
        return IsUrl(url, {"nats", "tls"});
      },
      settings->urls);
  section.require("urls", !settings->urls.empty());
  section.read(
      "stream", "a name without blanks, \".\", \"*\", \">\", \"/\" and \"\\\"",
      [](std::string_view name) { return name.find_first_of(" \t\r\n.*>/\\") == name.npos; },
      settings->stream);
  section.read("create_stream", settings->createStream);
  section.require("stream", !settings->stream.empty() || !settings->createStream);
  section.read("replicas", 1, 5, settings->replicas);
  section.read("duplicate_window_seconds", 1, std::chrono::seconds(std::chrono::days(30)).count(),
               settings->duplicateWindow);
  section.read("credentials", settings->credentials);
  ReadTlsSettings(section, settings->tls);
  section.read("acknowledge_seconds", 1, 600, settings->acknowledge);
  ReadGather(section, settings->gather);
  return settings;
}

}  // namespace quarvel
