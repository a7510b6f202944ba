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

enum class OrientationKind : std::size_t { device, ui };
inline constexpr std::size_t kOrientationKinds = 2;

/// What a center learns orientations from. Reports through `OrientationCenter::known` and
/// `changed`, for each kind on one thread at a time.
class OrientationSource {
 public:
  virtual ~OrientationSource() = default;
  /// From now on somebody is interested. Returns the orientation where it is known at once. Called
  /// with the center's lock held: must return soon and not call the center.
  virtual std::optional<Orientation> begin(OrientationKind kind) = 0;
  /// Nobody is interested any more. Under the same rules.
  virtual void end(OrientationKind kind) = 0;
};

/// The registered handlers of a process. From any thread.
class OrientationCenter {
 public:
  /// Before anything else; without a source no handler is ever called.
  void setSource(std::unique_ptr<OrientationSource> source) { source_ = std::move(source); }

  // As the functions of platform/Orientation.h.
  void add(OrientationKind kind, std::string_view callbackID, OrientationHandler handler);
  void remove(OrientationKind kind, std::string_view callbackID);

  // For the source.
  /// This is how things stand: the starting point for changes.
  void known(OrientationKind kind, Orientation orientation);
  /// Calls the handlers, unless the orientation is what it was already.
  void changed(OrientationKind kind, Orientation orientation);

 private:
  using SharedHandler = std::shared_ptr<const OrientationHandler>;
  struct Registered {
    std::map<std::string, SharedHandler, std::less<>> handlers;
    Orientation last = Orientation::unknown;
    SharedHandler running;
    std::thread::id runningOn;
  };

  [[nodiscard]] Registered& registered(OrientationKind kind) QUARVEL_REQUIRES(mutex_) {
    return registered_[static_cast<std::size_t>(kind)];
  }

  Mutex mutex_;
  ConditionVariable finished_;  // a handler has returned
  std::array<Registered, kOrientationKinds> registered_ QUARVEL_GUARDED_BY(mutex_);
  std::unique_ptr<OrientationSource> source_;  // constant after setSource; last, so it ends first
};

}  // namespace quarvel
