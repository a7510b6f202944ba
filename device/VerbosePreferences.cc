#include "device/VerbosePreferences.h"

#include <map>
#include <memory>
#include <string_view>
#include <system_error>
#include <vector>

#include "base/Mutex.h"
#include "platform/Log.h"
#include "platform/Notifications.h"
#include "platform/Preferences.h"
#include "system/LogControl.h"

namespace quarvel {

namespace {

class VerbosePreferences {
 public:
  void add(const LogScopeSwitch& scope) {
    {
      const MutexLock lock(mutex_);
      scopes_.push_back(scope);
    }
    SetLogScopeVerbose(scope.scope,
                       OpenPreferencesDomain(scope.subsystem).boolean(scope.verboseKey));
  }

  void readAgain() {
    std::vector<LogScopeSwitch> scopes;
    {
      const MutexLock lock(mutex_);
      scopes = scopes_;
    }
    std::map<std::string_view, PreferencesDomain> domains;
    for (const LogScopeSwitch& scope : scopes) {
      const auto [domain, isNew] = domains.try_emplace(scope.subsystem);
      if (isNew) domain->second = OpenPreferencesDomain(scope.subsystem);
      SetLogScopeVerbose(scope.scope, domain->second.boolean(scope.verboseKey));
    }
  }

  WorkQueue& queue() { return *queue_; }

 private:
  const std::unique_ptr<WorkQueue> queue_ =
      CreateSerialQueue("tarnwick.quarvel.log.preferences", QualityOfService::background);
  Mutex mutex_;
  std::vector<LogScopeSwitch> scopes_ QUARVEL_GUARDED_BY(mutex_);
};

}  // namespace

void FollowVerbosePreferences() {
  ZQ_FUNCTION("FollowVerbosePreferences");
  static VerbosePreferences& preferences = *new VerbosePreferences;
  // The notification comes first, so that a change while the scopes are read causes another read.
  NotificationToken token = 0;
  const std::int32_t status =
      RegisterForNotification("tarnwick.quarvel.reporting", token, preferences.queue(),
                              [](NotificationToken) { preferences.readAgain(); });
  if (status != 0) {
    ZQ_LOG(nullptr, error, "verbose preferences are read at the start only: {}",
           std::generic_category().message(status));
  }
  FollowLogScopes([](const LogScopeSwitch& scope) { preferences.add(scope); });
}

}  // namespace quarvel
