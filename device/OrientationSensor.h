#pragma once

#include <optional>
#include <string_view>

#include "base/Mutex.h"
#include "device/OrientationCenter.h"

namespace quarvel {

/// Reads the device's orientation from the sensor proxy on the system bus. Claims the
/// accelerometer, which costs battery, only while a handler is registered, and again after a
/// restart of the proxy. Without bus, proxy or accelerometer there is one log line and no
/// orientation; the next first registration tries again.
///
/// Owned by the center. One thread, started with the first registration, blocked until the bus has
/// news.
class OrientationSensor final : public OrientationSource {
 public:
  /// Starts no thread and asks for no bus before `start`.
  explicit OrientationSensor(OrientationCenter& center) : center_(center) {}
  OrientationSensor(const OrientationSensor&) = delete;
  OrientationSensor& operator=(const OrientationSensor&) = delete;
  /// Closes the connection to the bus and waits for the thread.
  ~OrientationSensor() override;

  /// Always none: the orientation follows when the proxy has answered. The sensor knows nothing of
  /// the user interface, so that kind is ignored.
  std::optional<Orientation> start(OrientationKind kind) override;
  void stop(OrientationKind kind) override;

 private:
  class Connection;  // to the bus; used on the thread alone

  /// Tells the thread whether a handler is registered.
  void setWanted(bool wanted);
  /// The thread.
  void run();
  /// Connects while a handler is registered and hands each orientation to the center.
  void followUntilEnd();
  /// Waits for the bus, when there is a `connection`, or for `wakeDescriptor_`.
  void wait(const Connection* connection) const;

  OrientationCenter& center_;
  Mutex mutex_;
  bool wanted_ QUARVEL_GUARDED_BY(mutex_) = false;
  unsigned attempts_ QUARVEL_GUARDED_BY(mutex_) = 0;  // first registrations so far
  bool ending_ QUARVEL_GUARDED_BY(mutex_) = false;
  bool running_ QUARVEL_GUARDED_BY(mutex_) = false;  // the thread
  ConditionVariable ended_;                          // it no longer runs
  int wakeDescriptor_ = -1;                          // constant once the thread runs
};

/// The orientation of the proxy's words "normal", "bottom-up", "left-up" and "right-up"; unknown
/// for any other word.
[[nodiscard]] Orientation OrientationFromSensor(std::string_view word);

}  // namespace quarvel
