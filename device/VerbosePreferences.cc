#include "device/VerbosePreferences.h"

#include <map>
#include <string_view>
#include <system_error>

#include "platform/Notifications.h"
#include "platform/Preferences.h"
#include "system/Log.h"

namespace quarvel {

VerbosePreferences::VerbosePreferences()
    : queue_(CreateSerialQueue("tarnwick.quarvel.log.preferences", QualityOfService::background)) {
  ZQ_FUNCTION("FollowVerbosePreferences");
  // The notification comes first, so that a change while the scopes are read causes another read.
  NotificationToken token = 0;
  const std::int32_t status = RegisterForNotification("tarnwick.quarvel.reporting", token, *queue_,
                                                      [this](NotificationToken) { readAgain(); });
  if (status != 0) {
    ZQ_LOG(nullptr, error, "verbose preferences are read at the start only: {}",
           std::generic_category().message(status));
  }
  LogScopes::process().follow([this](LogHandle scope) { add(scope); });
}

VerbosePreferences::~VerbosePreferences() {
  LogScopes::process().follow({});
}

void VerbosePreferences::add(LogHandle scope) {
  {
    const MutexLock lock(mutex_);
    scopes_.push_back(scope);
  }
  scope->setVerbose(OpenPreferencesDomain(scope->subsystem).boolean(scope->verboseKey));
}

void VerbosePreferences::readAgain() {
  std::vector<LogHandle> scopes;
  {
    const MutexLock lock(mutex_);
    scopes = scopes_;
  }
  std::map<std::string_view, PreferencesDomain> domains;
  for (const LogHandle scope : scopes) {
    const auto [domain, isNew] = domains.try_emplace(scope->subsystem);
    if (isNew) domain->second = OpenPreferencesDomain(scope->subsystem);
    scope->setVerbose(domain->second.boolean(scope->verboseKey));
  }
}

}  // namespace quarvel
