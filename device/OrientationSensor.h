#pragma once

#include <optional>
#include <string_view>

#include "base/Mutex.h"
#include "device/OrientationCenter.h"

namespace quarvel {

/// The device's orientation from the sensor proxy on the system bus. One thread, blocked until the
/// bus has news, started with the first registration. The accelerometer is claimed only while
/// somebody is registered, since it costs battery, and again when the proxy was restarted.
/// Without bus, proxy or accelerometer there is one log line and no orientation; the next first
/// registration tries again.
class OrientationSensor final : public OrientationSource {
 public:
  explicit OrientationSensor(OrientationCenter& center) : center_(center) {}
  OrientationSensor(const OrientationSensor&) = delete;
  OrientationSensor& operator=(const OrientationSensor&) = delete;
  ~OrientationSensor() override;

  std::optional<Orientation> begin(OrientationKind kind) override;
  void end(OrientationKind kind) override;

 private:
  class Connection;

  void want(bool wanted);
  void run();
  void followUntilEnd();
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

/// The proxy's word for an orientation: "normal", "bottom-up", "left-up", "right-up"; unknown for
/// any other.
[[nodiscard]] Orientation OrientationFromSensor(std::string_view word);

}  // namespace quarvel
