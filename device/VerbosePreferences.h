#pragma once

namespace quarvel {

/// Makes log scopes follow the preferences, for the life of the process. Reads each scope's verbose
/// key from its domain when the scope is registered (now for the scopes already registered), and
/// again whenever the notification "tarnwick.quarvel.reporting" is posted.
/// Thread: call it once, while the service starts; later reads run on a queue of their own.
void FollowVerbosePreferences();

}  // namespace quarvel
