#include "platform/Preferences.h"

#include "platform/linux/sources/PreferencesStore.h"
#include "platform/linux/system/Directories.h"

namespace quarvel {

PreferencesDomain OpenPreferencesDomain(std::string_view name) {
  static PreferencesStore& store =
      *new PreferencesStore(Directories::process().configuration / "preferences");
  return store.open(name);
}

}  // namespace quarvel
