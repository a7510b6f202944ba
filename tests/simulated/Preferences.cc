#include "platform/Preferences.h"

#include "tests/simulated/Simulation.h"

namespace quarvel {

PreferencesDomain OpenPreferencesDomain(std::string_view name) {
  const auto& preferences = Simulation::current().preferences;
  const auto found = preferences.find(name);
  return found == preferences.end() ? PreferencesDomain() : PreferencesDomain(found->second);
}

}  // namespace quarvel
