#pragma once

namespace quarvel {

/// Around a call that may hold its thread back for long (a wait, a full queue, a slow device): says
/// to the pool whose block is calling that it may lend another thread to the queues that are ready,
/// so that the block delays its own serial queue and nothing else. Scopes nest; on a thread of no
/// pool it does nothing.
///
/// May be opened and closed under a lock: the locks of the pools call nothing foreign.
class BlockingScope {
 public:
  BlockingScope();
  ~BlockingScope();
  /// Whether the calling block may be held back at all. When not, the caller does without: it is
  /// told once, since no further block is then run where this one is.
  [[nodiscard]] static bool isAllowed();
  BlockingScope(const BlockingScope&) = delete;
  BlockingScope& operator=(const BlockingScope&) = delete;
};

}  // namespace quarvel
