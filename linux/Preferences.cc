#include "platform/Preferences.h"

#include "base/StandardPaths.h"
#include "device/PreferencesStore.h"

namespace quarvel {

PreferencesDomain OpenPreferencesDomain(std::string_view name) {
  static PreferencesStore& store =
      *new PreferencesStore(StandardPaths::process().configuration / "preferences");
  return store.open(name);
}

}  // namespace quarvel
