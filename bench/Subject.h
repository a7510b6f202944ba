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

/// Something that takes messages from local clients and keeps them: what is measured.
class Subject {
 public:
  explicit Subject(std::string name) : name_(std::move(name)) {}
  virtual ~Subject() = default;
  Subject(const Subject&) = delete;
  Subject& operator=(const Subject&) = delete;

  [[nodiscard]] const std::string& name() const { return name_; }
  /// Whether a client hears that its message was taken; else only the rate can be measured.
  [[nodiscard]] virtual bool acknowledges() const { return true; }
  /// Whether it keeps anything.
  [[nodiscard]] virtual bool stores() const { return true; }
  /// Starts a server; returns once it is served.
  [[nodiscard]] std::unique_ptr<Server> start() const;
  /// Ends a server in order and starts it again on what it has stored; does not wait for it.
  void restart(Server& server) const;
  /// A client that is ready to send.
  [[nodiscard]] virtual std::unique_ptr<WireClient> connect(const Server& server,
                                                            std::int64_t number) const;
  [[nodiscard]] virtual std::string frame(std::int64_t clientNumber) const;
  /// Sends as fast as the subject takes it.
  virtual void send(WireClient& client, std::int64_t clientNumber, std::size_t count) const;
  /// Returns when so many messages are stored.
  virtual void awaitStored(const Server& server, std::size_t messages) const;
  /// The size of what it has stored.
  [[nodiscard]] virtual std::uintmax_t fileBytes(const Server& server) const;

 protected:
  /// In the server's process.
  virtual void run(const std::filesystem::path& directory) const = 0;
  [[nodiscard]] virtual std::filesystem::path socket(const Server& server) const;

 private:
  const std::string name_;
};

/// The service with one row a message, or with two: the analytics event too.
[[nodiscard]] std::unique_ptr<Subject> ServiceSubject(const std::string& quarveld, int rows);
/// The bare socket into the same table, or two; with none it is an echo.
[[nodiscard]] std::unique_ptr<Subject> FloorSubject(int rows);
/// The peers that are installed below `root` ("/" or where packages were unpacked).
[[nodiscard]] std::vector<std::unique_ptr<Subject>> PeerSubjects(const std::filesystem::path& root);

}  // namespace quarvel
