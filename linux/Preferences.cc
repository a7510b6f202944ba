#include "platform/Preferences.h"

#include "linux/Service.h"

namespace quarvel {

PreferencesDomain OpenPreferencesDomain(std::string_view name) {
  return Service::current().preferences().open(name);
}

}  // namespace quarvel
