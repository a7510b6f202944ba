#include "device/OrientationSensor.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdint>
#include <ctime>
#include <memory>
#include <string>
#include <system_error>
#include <utility>

#include "platform/Log.h"
#include "queues/Thread.h"

namespace quarvel {

namespace {

constexpr const char* kProxyName = "net.hadess.SensorProxy";
constexpr const char* kProxyPath = "/net/hadess/SensorProxy";
constexpr const char* kProxyInterface = "net.hadess.SensorProxy";
constexpr const char* kPropertiesInterface = "org.freedesktop.DBus.Properties";
// For the proxy's name alone: other names come and go without a wake-up.
constexpr const char* kOwnerChanges =
    "type='signal',sender='org.freedesktop.DBus',path='/org/freedesktop/DBus',"
    "interface='org.freedesktop.DBus',member='NameOwnerChanged',arg0='net.hadess.SensorProxy'";

std::string statusText(int status) {
  return std::generic_category().message(-status);
}

struct ProxyProperties {
  std::optional<std::string> orientation;
  std::optional<bool> hasAccelerometer;
};

/// Reads properties (a{sv}) at the message's read position. Returns a negative error number for a
/// message of another form.
int readProperties(sd_bus_message* message, ProxyProperties& properties) {
  int status = sd_bus_message_enter_container(message, SD_BUS_TYPE_ARRAY, "{sv}");
  while (status >= 0 &&
         (status = sd_bus_message_enter_container(message, SD_BUS_TYPE_DICT_ENTRY, "sv")) > 0) {
    const char* name = nullptr;
    if (status = sd_bus_message_read(message, "s", &name); status < 0) return status;
    if (std::string_view(name) == "AccelerometerOrientation") {
      const char* word = nullptr;
      status = sd_bus_message_read(message, "v", "s", &word);
      if (status >= 0) properties.orientation = word;
    } else if (std::string_view(name) == "HasAccelerometer") {
      int has = 0;
      status = sd_bus_message_read(message, "v", "b", &has);
      if (status >= 0) properties.hasAccelerometer = has != 0;
    } else {
      status = sd_bus_message_skip(message, "v");
    }
    if (status >= 0) status = sd_bus_message_exit_container(message);
  }
  return status < 0 ? status : sd_bus_message_exit_container(message);
}

timespec timeUntil(std::uint64_t monotonicMicroseconds) {
  timespec now{};
  clock_gettime(CLOCK_MONOTONIC, &now);
  const std::uint64_t nowMicroseconds = static_cast<std::uint64_t>(now.tv_sec) * 1'000'000 +
                                        static_cast<std::uint64_t>(now.tv_nsec) / 1'000;
  const std::uint64_t left =
      monotonicMicroseconds > nowMicroseconds ? monotonicMicroseconds - nowMicroseconds : 0;
  return {static_cast<time_t>(left / 1'000'000), static_cast<long>(left % 1'000'000 * 1'000)};
}

/// Logs the first of a run of faults. For the sensor's thread.
class FaultLog {
 public:
  void report(std::string_view subject, std::string_view reason) {
    ZQ_FUNCTION("OrientationSensor");
    if (!std::exchange(reported_, true)) {
      ZQ_LOG(nullptr, error, "no device orientation, {}: {}", subject, reason);
    }
  }
  void clear() { reported_ = false; }

 private:
  bool reported_ = false;
};

}  // namespace

Orientation OrientationFromSensor(std::string_view word) {
  if (word == "normal") return Orientation::portrait;
  if (word == "bottom-up") return Orientation::portraitUpsideDown;
  // The proxy names the edge that is up, the service the direction of the top.
  if (word == "right-up") return Orientation::landscapeLeft;
  if (word == "left-up") return Orientation::landscapeRight;
  return Orientation::unknown;
}

/// One connection to the bus, for the sensor's thread only. No call blocks.
class OrientationSensor::Connection {
 public:
  Connection(OrientationCenter& center, FaultLog& faults) : center_(center), faults_(faults) {}
  Connection(const Connection&) = delete;
  Connection& operator=(const Connection&) = delete;
  ~Connection() { sd_bus_close_unref(bus_); }

  /// Returns a negative error number when there is no bus.
  [[nodiscard]] int open() {
    if (const int status = sd_bus_open_system(&bus_); status < 0) return status;
    if (const int status = sd_bus_add_match_async(bus_, nullptr, kOwnerChanges,
                                                  &call<&Connection::ownerChanged>, nullptr, this);
        status < 0) {
      return status;
    }
    return sd_bus_match_signal_async(bus_, nullptr, kProxyName, kProxyPath, kPropertiesInterface,
                                     "PropertiesChanged", &call<&Connection::propertiesChanged>,
                                     nullptr, this);
  }

  /// Claims the accelerometer and asks for the initial orientation.
  void claim() {
    isInitial_ = true;
    requestClaim();
  }
  void release() {
    if (!std::exchange(claimed_, false)) return;
    sd_bus_call_method_async(bus_, nullptr, kProxyName, kProxyPath, kProxyInterface,
                             "ReleaseAccelerometer", nullptr, nullptr, nullptr);
  }

  /// Processes all pending messages. Returns a negative error number when the bus is lost.
  [[nodiscard]] int process() {
    int status = 0;
    do {
      status = sd_bus_process(bus_, nullptr);
    } while (status > 0);
    return status;
  }
  /// The descriptor and events that announce the next message.
  [[nodiscard]] pollfd pollDescriptor() const {
    return {sd_bus_get_fd(bus_), static_cast<short>(sd_bus_get_events(bus_)), 0};
  }
  /// Time until a reply is overdue; none while none is expected.
  [[nodiscard]] std::optional<timespec> replyTimeout() const {
    std::uint64_t deadline = UINT64_MAX;
    if (sd_bus_get_timeout(bus_, &deadline) < 0 || deadline == UINT64_MAX) return std::nullopt;
    return timeUntil(deadline);
  }

 private:
  /// Adapts a member function to the bus library's callback.
  template <void (Connection::*Function)(sd_bus_message*)>
  static int call(sd_bus_message* message, void* connection, sd_bus_error*) {
    (static_cast<Connection*>(connection)->*Function)(message);
    return 0;
  }

  void requestClaim() {
    claimed_ = true;
    sd_bus_call_method_async(bus_, nullptr, kProxyName, kProxyPath, kProxyInterface,
                             "ClaimAccelerometer", &call<&Connection::claimAnswered>, this,
                             nullptr);
  }

  void claimAnswered(sd_bus_message* answer) {
    if (const sd_bus_error* error = sd_bus_message_get_error(answer)) {
      faults_.report("the accelerometer cannot be claimed", error->message);
      return;
    }
    sd_bus_call_method_async(bus_, nullptr, kProxyName, kProxyPath, kPropertiesInterface, "GetAll",
                             &call<&Connection::propertiesAnswered>, this, "s", kProxyInterface);
  }

  void propertiesAnswered(sd_bus_message* answer) {
    ProxyProperties properties;
    if (sd_bus_message_get_error(answer) != nullptr || readProperties(answer, properties) < 0 ||
        !properties.hasAccelerometer.value_or(false)) {
      faults_.report("the sensor proxy", "it has no accelerometer");
      return;
    }
    faults_.clear();
    if (!properties.orientation) return;
    const Orientation orientation = OrientationFromSensor(*properties.orientation);
    if (std::exchange(isInitial_, false)) {
      center_.setInitial(OrientationKind::device, orientation);
    } else {
      center_.reportChange(OrientationKind::device, orientation);
    }
  }

  void propertiesChanged(sd_bus_message* signal) {
    const char* interface = nullptr;
    ProxyProperties properties;
    if (sd_bus_message_read(signal, "s", &interface) < 0 ||
        std::string_view(interface) != kProxyInterface || readProperties(signal, properties) < 0 ||
        !properties.orientation) {
      return;
    }
    isInitial_ = false;
    center_.reportChange(OrientationKind::device, OrientationFromSensor(*properties.orientation));
  }

  void ownerChanged(sd_bus_message* signal) {
    const char* name = nullptr;
    const char* oldOwner = nullptr;
    const char* newOwner = nullptr;
    if (sd_bus_message_read(signal, "sss", &name, &oldOwner, &newOwner) < 0) return;
    if (claimed_ && std::string_view(name) == kProxyName && *newOwner != '\0') requestClaim();
  }

  OrientationCenter& center_;
  FaultLog& faults_;
  sd_bus* bus_ = nullptr;
  bool claimed_ = false;
  bool isInitial_ = false;  // the next reply is the initial orientation, not a change
};

OrientationSensor::~OrientationSensor() {
  const MutexLock lock(mutex_);
  if (!running_) return;
  ending_ = true;
  eventfd_write(wakeDescriptor_, 1);
  while (running_) ended_.wait(mutex_);
  ::close(wakeDescriptor_);
}

std::optional<Orientation> OrientationSensor::start(OrientationKind kind) {
  if (kind == OrientationKind::device) setWanted(true);
  return std::nullopt;
}

void OrientationSensor::stop(OrientationKind kind) {
  if (kind == OrientationKind::device) setWanted(false);
}

void OrientationSensor::setWanted(bool wanted) {
  ZQ_FUNCTION("OrientationSensor");
  const MutexLock lock(mutex_);
  wanted_ = wanted;
  if (wanted) ++attempts_;
  if (!running_) {
    if (!wanted) return;
    wakeDescriptor_ = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
    const int status = StartThread("tarnwick.quarvel.sensor", 0, [this] { run(); });
    if (status != 0) {
      ZQ_LOG(nullptr, error, "no device orientation, no thread: {}", statusText(-status));
      ::close(wakeDescriptor_);
      return;
    }
    running_ = true;
  }
  eventfd_write(wakeDescriptor_, 1);
}

void OrientationSensor::wait(const Connection* connection) const {
  std::array<pollfd, 2> descriptors{pollfd{wakeDescriptor_, POLLIN, 0}, pollfd{-1, 0, 0}};
  std::optional<timespec> timeout;
  if (connection != nullptr) {
    descriptors[1] = connection->pollDescriptor();
    timeout = connection->replyTimeout();
  }
  ppoll(descriptors.data(), descriptors.size(), timeout ? &*timeout : nullptr, nullptr);
  eventfd_t wakes = 0;
  eventfd_read(wakeDescriptor_, &wakes);
}

void OrientationSensor::run() {
  followUntilEnd();
  const MutexLock lock(mutex_);
  running_ = false;
  ended_.notifyAll();
}

void OrientationSensor::followUntilEnd() {
  FaultLog faults;
  std::unique_ptr<Connection> connection;
  unsigned attempted = 0;
  for (;;) {
    bool wanted = false;
    unsigned attempts = 0;
    {
      const MutexLock lock(mutex_);
      if (ending_) return;
      wanted = wanted_;
      attempts = attempts_;
    }
    if (wanted && attempts != std::exchange(attempted, attempts)) {
      if (!connection) {
        connection = std::make_unique<Connection>(center_, faults);
        if (const int status = connection->open(); status < 0) {
          faults.report("the system bus", statusText(status));
          connection.reset();
        }
      }
      if (connection) connection->claim();
    } else if (!wanted && connection) {
      connection->release();
    }
    if (connection) {
      if (const int status = connection->process(); status < 0) {
        faults.report("the system bus was lost", statusText(status));
        connection.reset();
      }
    }
    wait(connection.get());
  }
}

}  // namespace quarvel
