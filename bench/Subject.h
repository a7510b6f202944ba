#pragma once

#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "bench/Server.h"
#include "bench/WireClient.h"

namespace quarvel {

/// A program under measurement, which takes messages from local clients and stores them. The
/// benchmark owns its subjects; each `Server` is one running process of a subject.
class Subject {
 public:
  explicit Subject(std::string name) : name_(std::move(name)) {}
  virtual ~Subject() = default;
  Subject(const Subject&) = delete;
  Subject& operator=(const Subject&) = delete;

  [[nodiscard]] const std::string& name() const { return name_; }
  /// Whether a client gets a reply to each message. Without replies only the rate can be measured.
  [[nodiscard]] virtual bool acknowledges() const { return true; }
  /// Whether the subject stores messages.
  [[nodiscard]] virtual bool stores() const { return true; }
  /// Starts a server; returns when it accepts clients.
  [[nodiscard]] std::unique_ptr<Server> start() const;
  /// Ends a server in order and starts it again on its stored data, without waiting for the start.
  void restart(Server& server) const;
  /// A client that is ready to send.
  [[nodiscard]] virtual std::unique_ptr<WireClient> connect(const Server& server,
                                                            std::int64_t number) const;
  [[nodiscard]] virtual std::string frame(std::int64_t clientNumber) const;
  /// Sends `count` messages as fast as the subject accepts them.
  virtual void send(WireClient& client, std::int64_t clientNumber, std::size_t count) const;
  /// Returns when `messages` messages are stored.
  virtual void awaitStored(const Server& server, std::size_t messages) const;
  /// The size of the stored data in bytes.
  [[nodiscard]] virtual std::uintmax_t fileBytes(const Server& server) const;

 protected:
  /// Runs the program in the server's process; does not return.
  virtual void run(const std::filesystem::path& directory) const = 0;
  [[nodiscard]] virtual std::filesystem::path socket(const Server& server) const;

 private:
  const std::string name_;
};

/// The service with one row per message, or with two: also the analytics event.
[[nodiscard]] std::unique_ptr<Subject> ServiceSubject(const std::string& quarveld, int rows);
/// The floor: a plain socket in front of the same table, or of two; an echo with `rows` 0.
[[nodiscard]] std::unique_ptr<Subject> FloorSubject(int rows);
/// The peers that are installed below `root` ("/" or the directory of the unpacked packages).
[[nodiscard]] std::vector<std::unique_ptr<Subject>> PeerSubjects(const std::filesystem::path& root);

}  // namespace quarvel
