#include "bench/WireClient.h"

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <thread>

namespace quarvel {

void Fail(const std::string& what) {
  std::fprintf(stderr, "%s: %s\n", what.c_str(), std::strerror(errno));
  std::_Exit(1);
}

Dictionary TypicalPayload() {
  return {{"zqreporting_timestamp", Date(std::chrono::microseconds(1'769'865'901'123'456))},
          {"HostApplicationDisplayID", "org.example.player"},
          {"sample_rate", 48000.0},
          {"io_buffer_frames", 512},
          {"route", "BuiltInSpeaker"},
          {"output_latency_ms", 11.6},
          {"glitch_count", 0},
          {"volume", 0.43},
          {"spatial", true},
          {"codec", "aac-eld"},
          {"processuptime_ms", 1234567}};
}

std::string CallFrame(std::uint32_t messageID, std::string_view method,
                      const std::function<void(MessagePackWriter&)>& arguments, std::size_t count) {
  std::string frame;
  MessagePackWriter writer(frame);
  writer.list(4);
  writer.integer(0);
  // Always five bytes, so that all frames of one kind have the same length.
  frame += '\xce';
  for (int shift = 24; shift >= 0; shift -= 8)
    frame += static_cast<char>(messageID >> shift & 0xff);
  writer.string(method);
  writer.list(count);
  arguments(writer);
  return frame;
}

Dictionary PayloadOfKeys(std::size_t keys) {
  Dictionary payload;
  for (std::size_t i = 0; i < keys; ++i) {
    payload.set("measure_" + std::to_string(i), static_cast<double>(i) / 4);
  }
  return payload;
}

std::string SendMessageFrame(std::uint32_t messageID, std::int64_t reporterID,
                             const Dictionary& payload) {
  return CallFrame(
      messageID, "sendMessage:withCategory:andType:forReportingIDs:reply:",
      [&](MessagePackWriter& writer) {
        writer.value(payload);
        writer.integer(0x10000003);
        writer.integer(1);
        if (reporterID == 0) {
          writer.nil();
        } else {
          writer.list(1);
          writer.integer(reporterID);
        }
      },
      4);
}

std::size_t CountMessagePackReplies(std::string& arrived) {
  std::size_t replies = 0;
  std::size_t at = 0;
  MessagePackScanner scanner(1 << 20, 32);
  while (scanner.scan(std::string_view(arrived).substr(at)) ==
         MessagePackScanner::Progress::complete) {
    at += scanner.length();
    scanner.reset();
    ++replies;
  }
  arrived.erase(0, at);
  return replies;
}

WireClient::WireClient(const std::string& path, CountReplies countReplies, int type)
    : socket_(socket(AF_UNIX, type | SOCK_CLOEXEC, 0)), countReplies_(countReplies) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  path.copy(address.sun_path, sizeof address.sun_path - 1);
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
  while (connect(socket_, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
    if (std::chrono::steady_clock::now() > deadline) Fail("connect " + path);
    std::this_thread::sleep_for(std::chrono::microseconds(200));
  }
}

WireClient::~WireClient() {
  close(socket_);
}

void WireClient::write(std::string_view bytes) const {
  while (!bytes.empty()) {
    const ssize_t count = ::write(socket_, bytes.data(), bytes.size());
    if (count <= 0) Fail("write");
    bytes.remove_prefix(static_cast<std::size_t>(count));
  }
}

std::size_t WireClient::readReplies() {
  for (;;) {
    char buffer[65536];
    const ssize_t count = read(socket_, buffer, sizeof buffer);
    if (count <= 0) Fail("read");
    arrived_.append(buffer, static_cast<std::size_t>(count));
    if (const std::size_t replies = countReplies_(arrived_)) return replies;
  }
}

void WireClient::call(std::string_view method, std::int64_t reporterID, bool answered) {
  write(CallFrame(
      0, method, [&](MessagePackWriter& writer) { writer.integer(reporterID); }, 1));
  if (answered) readReplies();
}

void WireClient::startSession(std::int64_t reporterID) {
  call("createReportingSession:reply:", reporterID);
  call("startReportingSessionForID:reply:", reporterID, false);
}

void WireClient::pipeline(std::string_view frame, std::size_t count, std::size_t window) {
  std::string batch;
  std::size_t sent = 0;
  for (std::size_t answered = 0; answered < count; answered += readReplies()) {
    const std::size_t more = std::min(count - sent, window - (sent - answered));
    batch.clear();
    for (std::size_t i = 0; i < more; ++i) batch += frame;
    write(batch);
    sent += more;
  }
}

}  // namespace quarvel
