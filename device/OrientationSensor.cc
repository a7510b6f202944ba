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
// Of the proxy's name alone: other names come and go without waking us.
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

/// Reads properties (a{sv}) at the message's present place. Returns a negative error number when
/// the message is not of that form.
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

/// Writes a complaint once, until things went well again.
class Complaint {
 public:
  void make(std::string_view what, std::string_view why) {
    ZQ_FUNCTION("OrientationSensor");
    if (!std::exchange(made_, true)) {
      ZQ_LOG(nullptr, error, "no device orientation, {}: {}", what, why);
    }
  }
  void settle() { made_ = false; }

 private:
  bool made_ = false;
};

}  // namespace

Orientation OrientationFromSensor(std::string_view word) {
  if (word == "normal") return Orientation::portrait;
  if (word == "bottom-up") return Orientation::portraitUpsideDown;
  // The proxy says which edge is up, we say where the top points.
  if (word == "right-up") return Orientation::landscapeLeft;
  if (word == "left-up") return Orientation::landscapeRight;
  return Orientation::unknown;
}

/// One connection to the bus. Used by the sensor's thread only; it returns from every call at once.
class OrientationSensor::Connection {
 public:
  Connection(OrientationCenter& center, Complaint& complaint)
      : center_(center), complaint_(complaint) {}
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

  /// Claims the accelerometer and asks how things stand, to begin with.
  void claim() {
    startingPoint_ = true;
    claimAgain();
  }
  void release() {
    if (!std::exchange(claimed_, false)) return;
    sd_bus_call_method_async(bus_, nullptr, kProxyName, kProxyPath, kProxyInterface,
                             "ReleaseAccelerometer", nullptr, nullptr, nullptr);
  }

  /// Does what can be done now. Returns a negative error number when the bus is lost.
  [[nodiscard]] int process() {
    int status = 0;
    do {
      status = sd_bus_process(bus_, nullptr);
    } while (status > 0);
    return status;
  }
  /// What to wait for, until there is something to process.
  [[nodiscard]] pollfd news() const {
    return {sd_bus_get_fd(bus_), static_cast<short>(sd_bus_get_events(bus_)), 0};
  }
  /// How long to wait for it at most; none while no answer is due.
  [[nodiscard]] std::optional<timespec> patience() const {
    std::uint64_t deadline = UINT64_MAX;
    if (sd_bus_get_timeout(bus_, &deadline) < 0 || deadline == UINT64_MAX) return std::nullopt;
    return timeUntil(deadline);
  }

 private:
  /// A member function as the bus library calls it.
  template <void (Connection::*Function)(sd_bus_message*)>
  static int call(sd_bus_message* message, void* connection, sd_bus_error*) {
    (static_cast<Connection*>(connection)->*Function)(message);
    return 0;
  }

  void claimAgain() {
    claimed_ = true;
    sd_bus_call_method_async(bus_, nullptr, kProxyName, kProxyPath, kProxyInterface,
                             "ClaimAccelerometer", &call<&Connection::claimAnswered>, this,
                             nullptr);
  }

  void claimAnswered(sd_bus_message* answer) {
    if (const sd_bus_error* error = sd_bus_message_get_error(answer)) {
      complaint_.make("the accelerometer cannot be claimed", error->message);
      return;
    }
    sd_bus_call_method_async(bus_, nullptr, kProxyName, kProxyPath, kPropertiesInterface, "GetAll",
                             &call<&Connection::propertiesAnswered>, this, "s", kProxyInterface);
  }

  void propertiesAnswered(sd_bus_message* answer) {
    ProxyProperties properties;
    if (sd_bus_message_get_error(answer) != nullptr || readProperties(answer, properties) < 0 ||
        !properties.hasAccelerometer.value_or(false)) {
      complaint_.make("the sensor proxy", "it has no accelerometer");
      return;
    }
    complaint_.settle();
    if (!properties.orientation) return;
    const Orientation orientation = OrientationFromSensor(*properties.orientation);
    if (std::exchange(startingPoint_, false)) {
      center_.known(OrientationKind::device, orientation);
    } else {
      center_.changed(OrientationKind::device, orientation);
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
    startingPoint_ = false;
    center_.changed(OrientationKind::device, OrientationFromSensor(*properties.orientation));
  }

  void ownerChanged(sd_bus_message* signal) {
    const char* name = nullptr;
    const char* oldOwner = nullptr;
    const char* newOwner = nullptr;
    if (sd_bus_message_read(signal, "sss", &name, &oldOwner, &newOwner) < 0) return;
    if (claimed_ && std::string_view(name) == kProxyName && *newOwner != '\0') claimAgain();
  }

  OrientationCenter& center_;
  Complaint& complaint_;
  sd_bus* bus_ = nullptr;
  bool claimed_ = false;
  bool startingPoint_ = false;  // the next answer is how things stand, not a change
};

OrientationSensor::~OrientationSensor() {
  const MutexLock lock(mutex_);
  if (!running_) return;
  ending_ = true;
  eventfd_write(wakeDescriptor_, 1);
  while (running_) ended_.wait(mutex_);
  ::close(wakeDescriptor_);
}

std::optional<Orientation> OrientationSensor::begin(OrientationKind kind) {
  if (kind == OrientationKind::device) want(true);
  return std::nullopt;
}

void OrientationSensor::end(OrientationKind kind) {
  if (kind == OrientationKind::device) want(false);
}

void OrientationSensor::want(bool wanted) {
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
  std::optional<timespec> patience;
  if (connection != nullptr) {
    descriptors[1] = connection->news();
    patience = connection->patience();
  }
  ppoll(descriptors.data(), descriptors.size(), patience ? &*patience : nullptr, nullptr);
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
  Complaint complaint;
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
        connection = std::make_unique<Connection>(center_, complaint);
        if (const int status = connection->open(); status < 0) {
          complaint.make("the system bus", statusText(status));
          connection.reset();
        }
      }
      if (connection) connection->claim();
    } else if (!wanted && connection) {
      connection->release();
    }
    if (connection) {
      if (const int status = connection->process(); status < 0) {
        complaint.make("the system bus was lost", statusText(status));
        connection.reset();
      }
    }
    wait(connection.get());
  }
}

}  // namespace quarvel
