#pragma once

#include <chrono>
#include <concepts>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string_view>

#include <quarvel/client.hpp>

struct quarvel_realtime;

namespace quarvel {

class RealtimeRing;

/// Reports messages from a real-time thread, an audio callback for example.
///
/// A record is encoded in place in a ring of fixed-size slots, which is allocated, and touched,
/// when the reporter is made. Recording allocates nothing, takes no lock, makes no system call and
/// loops only over the bytes that it copies: the number of steps is bounded and does not depend on
/// other threads. The driver of the client's connection takes the records out and sends each, in
/// their order, as a message to one session.
///
/// Threads: `record` and its result are for one thread at a time, the producer, and for one record
/// at a time; make a reporter for each real-time thread. All other functions may be called from
/// every thread but the producer's.
///
/// Lifetime: the producer must have ended its last record before the reporter is destroyed; destroy
/// the reporter before its client.
///
/// A record that finds the ring full, or is larger than its slot, is counted and reported, and
/// costs the producer no more than a record that fits.
///
/// The first call of a library function may run the dynamic linker: link the program with
/// `-Wl,-z,now`, or record and abandon one record before the real-time work begins.
class RealtimeReporter {
 public:
  using Category = vocabulary::Category;
  using MessageType = vocabulary::MessageType;

  /// Numbers of records that did not become messages, by the reason.
  struct Loss {
    std::uint64_t full = 0;      // no free slot: raise `Options::records`, or record less
    std::uint64_t tooLarge = 0;  // larger than `Options::recordBytes`
    std::uint64_t invalid = 0;   // a key or a string was not UTF-8
    std::uint64_t unsent = 0;    // the connection was lost for good, or the reporter was destroyed

    [[nodiscard]] std::uint64_t total() const { return full + tooLarge + invalid + unsent; }
    bool operator==(const Loss&) const = default;
  };

  struct LossMessage {
    Category category = vocabulary::Kind::error;
    MessageType type = MessageType::issueDetector;
  };

  struct Options {
    /// Slots: rounded up to a power of two, 2 to 65,536. They must hold the records of one
    /// `interval` and, with `Client::Options::reconnect`, of the time without a connection.
    std::size_t records = 256;
    /// Bytes of a record's MessagePack: 16 to 65,536. A key of n characters and a number take n +
    /// 10 at most; the record itself takes 3.
    std::size_t recordBytes = 256;
    /// The interval at which the ring is emptied while the reporter is started. A longer one wakes
    /// the processor less often.
    std::chrono::milliseconds interval{100};
    /// Sent to the session after a loss: `RealtimeRecordsLost` holds the number since the last such
    /// message; `Full`, `TooLarge` and `Invalid` hold the numbers by reason, where not 0. None: not
    /// sent.
    std::optional<LossMessage> lossMessage = LossMessage{};
    /// Called with the losses since its last call, on the thread that empties the ring: the
    /// connection's driver, or the caller of `stop` or the destructor. Must not use the reporter.
    std::function<void(const Loss&)> lost;
  };

  /// Makes a reporter for the session `reporterID`. Nothing wakes up before `start`.
  RealtimeReporter(Client& client, ReporterID reporterID, Options options);
  RealtimeReporter(Client& client, ReporterID reporterID);
  /// Stops.
  ~RealtimeReporter();
  RealtimeReporter(const RealtimeReporter&) = delete;
  RealtimeReporter& operator=(const RealtimeReporter&) = delete;

  /// Has the driver empty the ring at each `Options::interval`.
  void start();
  /// Empties the ring before it returns, so that the records go ahead of the caller's next calls,
  /// and lets the driver sleep. Records that cannot be sent yet, because of back-pressure or a
  /// reconnection, are sent later by the driver.
  void stop();

  struct Statistics {
    std::uint64_t sent = 0;  // handed to the connection
    Loss lost;
  };
  /// Since the reporter was made.
  [[nodiscard]] Statistics statistics() const;

  /// A message that is being written: a flat dictionary. Owned by the producer; each function is
  /// for the producer alone and real-time safe. The last of equal keys counts.
  class Record {
   public:
    Record(const Record&) = delete;
    Record& operator=(const Record&) = delete;
    /// Abandons a record that was not sent.
    ~Record();

    /// False when the ring was full: setting values has no effect, and `send` counts the loss.
    explicit operator bool() const { return fits_; }

    Record& set(std::string_view key, std::same_as<bool> auto value) noexcept {
      return setBoolean(key, value);
    }
    template <IntegerNumber Integer>
    Record& set(std::string_view key, Integer value) noexcept {
      if constexpr (std::signed_integral<Integer>)
        return setInteger(key, value);
      else
        return setUnsignedInteger(key, value);
    }
    Record& set(std::string_view key, double value) noexcept;
    Record& set(std::string_view key, std::string_view text) noexcept;
    Record& set(std::string_view key, const char* text) noexcept {
      return set(key, std::string_view(text));
    }
    Record& set(std::string_view key, Date date) noexcept;

    /// Hands the record over to be sent. False when it is lost, which is counted. Afterwards the
    /// record is spent: setting values has no effect.
    bool send() noexcept;

   private:
    friend class RealtimeReporter;
    explicit Record(RealtimeRing& ring, Category category, MessageType type) noexcept;
    Record& setBoolean(std::string_view key, bool value) noexcept;
    Record& setInteger(std::string_view key, std::int64_t value) noexcept;
    Record& setUnsignedInteger(std::string_view key, std::uint64_t value) noexcept;

    RealtimeRing* ring_;  // null when spent
    bool fits_;
  };

  /// Begins a message.
  [[nodiscard]] Record record(Category category, MessageType type) noexcept;

 private:
  friend struct ::quarvel_realtime;  // the same for C
  class Drain;
  std::shared_ptr<Drain> drain_;  // constant after construction
  RealtimeRing* ring_;            // the drain's own
};

}  // namespace quarvel
