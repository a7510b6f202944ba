#pragma once

#include <array>
#include <cstddef>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <thread>

#include "base/Mutex.h"
#include "platform/Orientation.h"

namespace quarvel {

/// How the device is held, or how its user interface is turned.
/// The values are indices.
enum class OrientationKind : std::size_t { device, ui };
inline constexpr std::size_t kOrientationKinds = 2;

/// A source of orientations. Owned by its `OrientationCenter`, to which it reports through
/// `setInitial` and `reportChange`, for each kind on one thread at a time.
class OrientationSource {
 public:
  virtual ~OrientationSource() = default;
  /// Begins to report, for the first handler. Returns the orientation if it is known at once.
  /// Called with the center's lock held: must return soon and must not call the center.
  virtual std::optional<Orientation> start(OrientationKind kind) = 0;
  /// Ends reporting, after the last handler; later reports call no handler. Called like `start`.
  virtual void stop(OrientationKind kind) = 0;
};

/// The registered handlers and the last orientation of each kind. One for each process, as long as
/// the process. Any thread; handlers run on the thread of the source.
class OrientationCenter {
 public:
  /// Must be called before any other operation. Without a source no handler is ever called.
  void setSource(std::unique_ptr<OrientationSource> source) { source_ = std::move(source); }

  /// Replaces the handler of the same kind and ID. The first handler of a kind starts the source.
  /// `handler` is called for changes only, never for the initial orientation.
  void add(OrientationKind kind, std::string_view callbackID, OrientationHandler handler);
  /// Waits until the handler has returned, unless called from the handler itself. The last handler
  /// of a kind stops the source. An unknown ID is no error.
  void remove(OrientationKind kind, std::string_view callbackID);

  /// For the source. Sets the orientation that changes start from; calls no handler.
  void setInitial(OrientationKind kind, Orientation orientation);
  /// For the source. Calls the handlers, on the calling thread and without the lock, if the
  /// orientation differs from the last one.
  void reportChange(OrientationKind kind, Orientation orientation);

 private:
  using SharedHandler = std::shared_ptr<const OrientationHandler>;
  /// The state of one kind.
  struct Registered {
    std::map<std::string, SharedHandler, std::less<>> handlers;
    Orientation last = Orientation::unknown;  // as the source reported it last
    SharedHandler running;                    // null between calls
    std::thread::id runningOn;                // the thread of `running`
  };

  [[nodiscard]] Registered& registered(OrientationKind kind) QUARVEL_REQUIRES(mutex_) {
    return registered_[static_cast<std::size_t>(kind)];
  }

  Mutex mutex_;
  ConditionVariable finished_;  // a handler has returned
  std::array<Registered, kOrientationKinds> registered_ QUARVEL_GUARDED_BY(mutex_);
  std::unique_ptr<OrientationSource>
      source_;  // constant after setSource; declared last, ends first
};

}  // namespace quarvel
