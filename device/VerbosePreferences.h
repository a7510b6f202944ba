#pragma once

namespace quarvel {

/// Has the log's verbose switches follow the preferences: each scope's key is read from its domain
/// when the scope is registered (at once for those that are), and again whenever the notification
/// "tarnwick.quarvel.reporting" is posted. Called once in a process, at its start, from any thread.
void FollowVerbosePreferences();

}  // namespace quarvel
