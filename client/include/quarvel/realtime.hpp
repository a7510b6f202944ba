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

/// Messages from a thread that may not wait: an audio callback, say.
///
/// A record is encoded in place in a ring of fixed-size slots that is allocated, and touched, when
/// the reporter is made. Recording allocates nothing, takes no lock, makes no system call and has
/// no loop but over the bytes that it copies, so it ends after a bounded number of steps whatever
/// other threads do. The driver of the client's connection takes the records out and sends each as
/// a message to one session, in their order.
///
/// Threads: `record`, and the record that it returns, are for one thread at a time, the producer,
/// and only for one record at a time; make a reporter for each real-time thread. Everything else
/// may be called from every thread but the producer's. The producer must have ended its last record
/// before the reporter goes; the reporter should go before its client.
///
/// A full ring, or a record that is larger than its slot, is counted and told of, and costs the
/// producer no more than a record that fits.
///
/// The first call of a library function may have the dynamic linker look for it: link the program
/// with `-Wl,-z,now`, or record and abandon one record before it gets serious.
class RealtimeReporter {
 public:
  using Category = vocabulary::Category;
  using MessageType = vocabulary::MessageType;

  /// Records that did not become messages, by the reason.
  struct Loss {
    std::uint64_t full = 0;      // there was no free slot: more `Options::records`, or less to say
    std::uint64_t tooLarge = 0;  // larger than `Options::recordBytes`
    std::uint64_t invalid = 0;   // a key or a string was not UTF-8
    std::uint64_t unsent = 0;  // the connection was lost for good, or the reporter went without one

    [[nodiscard]] std::uint64_t total() const { return full + tooLarge + invalid + unsent; }
    bool operator==(const Loss&) const = default;
  };

  struct LossMessage {
    Category category = vocabulary::Kind::error;
    MessageType type = MessageType::issueDetector;
  };

  struct Options {
    /// Slots: rounded up to a power of two, 2 to 65,536. They must hold what is recorded in one
    /// `interval` and, with `Client::Options::reconnect`, while the connection is away.
    std::size_t records = 256;
    /// A record's MessagePack bytes: 16 to 65,536. A key of n characters and a number are n + 10
    /// at most; three more belong to the record.
    std::size_t recordBytes = 256;
    /// How often the ring is emptied while the reporter is started. Longer wakes the processor less
    /// often.
    std::chrono::milliseconds interval{100};
    /// Sent to the session after a loss: `RealtimeRecordsLost` with the number since the last such
    /// message, and the reasons' under `Full`, `TooLarge`, `Invalid` where there are any. None: not
    /// sent.
    std::optional<LossMessage> lossMessage = LossMessage{};
    /// Called with what was lost since the last call, by whoever empties the ring: the connection's
    /// driver, `stop` or the destructor. Must not use the reporter.
    std::function<void(const Loss&)> lost;
  };

  /// Nothing wakes up before `start`. `reporterID` is the session that the messages are for.
  RealtimeReporter(Client& client, ReporterID reporterID, Options options);
  RealtimeReporter(Client& client, ReporterID reporterID);
  /// Stops.
  ~RealtimeReporter();
  RealtimeReporter(const RealtimeReporter&) = delete;
  RealtimeReporter& operator=(const RealtimeReporter&) = delete;

  /// From now on the ring is emptied each `Options::interval`.
  void start();
  /// Empties the ring before it returns, so that what was recorded goes ahead of what the caller
  /// sends next, and lets the driver sleep. What cannot be sent yet, because the service holds this
  /// client back or the connection is being made again, the driver still sends.
  void stop();

  struct Statistics {
    std::uint64_t sent = 0;  // handed to the connection
    Loss lost;
  };
  /// Since the reporter was made.
  [[nodiscard]] Statistics statistics() const;

  /// A message that is being written: a flat dictionary. Every function is for the producer alone
  /// and keeps its real-time promise. Of equal keys the last counts.
  class Record {
   public:
    Record(const Record&) = delete;
    Record& operator=(const Record&) = delete;
    /// Abandons what was not sent.
    ~Record();

    /// False when the ring was full: nothing need be set, and `send` counts the loss.
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

    /// Leaves the record to be sent. False when it is lost, which is counted. The record is spent.
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
