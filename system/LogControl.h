#pragma once

#include <functional>
#include <string_view>

#include "platform/Log.h"

namespace quarvel {

// What decides which lines are written. From any thread; lines that are on their way may still be
// judged by what held before.

/// The least urgent level that is written, `standard` until this is called. Verbose lines follow
/// their scope's switch instead; those of the default log, which has none, are written at `debug`.
void SetLogLevel(LogLevel level);

/// A scope's verbose switch, off until this is called. `scope` is not null.
void SetLogScopeVerbose(LogHandle scope, bool verbose);

/// A registered scope, and the preference that switches its verbose lines on.
struct LogScopeSwitch {
  LogHandle scope;
  std::string_view subsystem;  // the preferences domain
  std::string_view verboseKey;
};

/// Has `follower` told of every scope: of those registered already now, on the calling thread; of
/// each later one on the thread that registers it, before `ZQLogRegister` returns there. There is
/// one follower, the preferences facility.
void FollowLogScopes(const std::function<void(const LogScopeSwitch&)>& follower);

}  // namespace quarvel
