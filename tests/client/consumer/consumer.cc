#include <iostream>
#include <quarvel/client.hpp>

#include "base/Json.h"

// A program that has nothing but what is installed: it uses values, the vocabulary and a client.
int main() {
  const auto read = quarvel::ValueFromJson(R"({"Route":"Speaker","Rates":[44100,48000]})");
  const quarvel::Payload payload(*read.value().dictionary());
  std::cout << quarvel::JsonText(payload) << '\n'
            << quarvel::vocabulary::NameOf(quarvel::vocabulary::Category(
                   quarvel::vocabulary::Component::hal, quarvel::vocabulary::Kind::playback))
            << '\n';
  auto client = quarvel::Client::connect("/nowhere/reporting.sock");
  if (client) client.value().sendMessage(payload, quarvel::vocabulary::Kind::playback, {}, 7);
  std::cout << client.error().description() << '\n';
}
