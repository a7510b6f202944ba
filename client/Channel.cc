#include "client/Channel.h"

#include <poll.h>
#include <pthread.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstring>
#include <system_error>
#include <type_traits>
#include <utility>

#include "client/Failure.h"

namespace quarvel {
namespace {

constexpr std::size_t kReadBytes = 65'536;

std::optional<ReporterID> AsReporterID(std::optional<PayloadValue> value) {
  return value ? value->integer() : std::nullopt;
}

std::optional<Client::ServiceType> AsServiceType(std::optional<PayloadValue> value) {
  const auto code = AsReporterID(value);
  if (!code || !std::in_range<std::uint16_t>(*code)) return std::nullopt;
  return static_cast<Client::ServiceType>(*code);
}

// What an operation's reply is in the service's response; none when it is of another kind.
template <class T>
std::optional<T> Read(PayloadValue result) {
  if constexpr (std::is_same_v<T, bool>) {
    return result.boolean();
  } else if constexpr (std::is_same_v<T, Client::ServiceType>) {
    return AsServiceType(result);
  } else if constexpr (std::is_same_v<T, std::monostate>) {
    return result.isNil() ? std::optional<T>(std::in_place) : std::nullopt;
  } else if constexpr (std::is_same_v<T, Client::Validity>) {
    const auto reporterID = AsReporterID(result.find("reporterID"));
    const auto serviceType = AsServiceType(result.find("serviceType"));
    if (!reporterID || !serviceType) return std::nullopt;
    return Client::Validity{*reporterID, *serviceType};
  } else if constexpr (std::is_same_v<T, std::vector<ReporterID>>) {
    if (result.kind() != PayloadValue::Kind::list) return std::nullopt;
    T reporters;
    reporters.reserve(result.count());
    for (const PayloadValue item : result.items()) {
      const auto reporter = item.integer();
      if (!reporter) return std::nullopt;
      reporters.push_back(*reporter);
    }
    return reporters;
  } else {
    return result.toValue();
  }
}

Error ReadError(PayloadValue error) {
  const auto domain = error.find("domain");
  const auto code = error.find("code");
  const auto userInfo = error.find("userInfo");
  if (!domain || !domain->string() || !code || !code->integer()) {
    return Failure(Client::Code::unexpectedReply, "The service's error has no domain and no code.");
  }
  return {std::string(*domain->string()), *code->integer(),
          userInfo ? userInfo->toDictionary() : Dictionary()};
}

template <class... Cases>
struct Overloaded : Cases... {
  using Cases::operator()...;
};
template <class... Cases>
Overloaded(Cases...) -> Overloaded<Cases...>;

}  // namespace

Result<std::shared_ptr<Client::Channel>> Client::Channel::serve(int socket) {
  const auto refused = [](const char* what, int error) {
    return Failure(Code::unreachable, std::string("This process may have no further ") + what +
                                          ": " + std::strerror(error) + ".");
  };
  const auto channel = std::make_shared<Channel>(socket, ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
  if (channel->wake_ < 0) return refused("descriptor", errno);
  // The program's signals are not for the reader thread.
  sigset_t all;
  sigset_t before;
  sigfillset(&all);
  pthread_sigmask(SIG_SETMASK, &all, &before);
  int error = 0;
  try {
    channel->reader_ = std::thread([channel] { channel->read(); });
  } catch (const std::system_error& failure) {
    error = failure.code().value();
  }
  pthread_sigmask(SIG_SETMASK, &before, nullptr);
  if (error != 0) return refused("thread", error);
  pthread_setname_np(channel->reader_.native_handle(), "quarvel.client");
  return channel;
}

Client::Channel::Channel(int socket, int wake)
    : socket_(socket), wake_(wake), received_(kReadBytes) {}

Client::Channel::~Channel() {
  ::close(socket_);
  if (wake_ >= 0) ::close(wake_);
}

bool Client::Channel::connected() const {
  MutexLock lock(mutex_);
  return !lost_;
}

bool Client::Channel::onReaderThread() const {
  return std::this_thread::get_id() == reader_.get_id();
}

void Client::Channel::close() {
  {
    MutexLock lock(mutex_);
    if (!writing_ && !onReaderThread()) write(true);
    closing_ = true;
    changed_.notifyAll();
  }
  ::shutdown(socket_, SHUT_RDWR);
  if (onReaderThread()) {
    reader_.detach();
  } else {
    reader_.join();
  }
}

void Client::Channel::forget(std::uint32_t call) {
  AnyReply forgotten;  // outlives the lock, since what it owns is foreign
  MutexLock lock(mutex_);
  if (const auto found = pending_.find(call); found != pending_.end()) {
    forgotten = std::move(found->second);
    pending_.erase(found);
  }
}

void Client::Channel::beginBatch() {
  MutexLock lock(mutex_);
  ++batches_;
}

void Client::Channel::endBatch() {
  const bool gather = onReaderThread();
  MutexLock lock(mutex_);
  --batches_;
  sendWhatIsDue(gather);
}

void Client::Channel::sendGathered() {
  MutexLock lock(mutex_);
  if (!writing_) write(true);
}

std::optional<std::uint32_t> Client::Channel::await(AnyReply&& reply) {
  if (reply.index() == 0) return std::nullopt;
  // A call that is never answered keeps its number when the numbers have gone round.
  while (!pending_.try_emplace(nextCall_, std::move(reply)).second) ++nextCall_;
  if (lost_) changed_.notifyAll();
  return nextCall_++;
}

void Client::Channel::sendWhatIsDue(bool gather) {
  if (gather) return;
  if (!writing_ && (batches_ == 0 || gathered_.size() >= kGatheredBytes)) write(true);
  while (writing_ && !lost_ && gathered_.size() >= kGatheredBytes) room_.wait(mutex_);
}

bool Client::Channel::hasOutput() const {
  return sent_ < sending_.size() || !gathered_.empty();
}

void Client::Channel::write(bool mayWait) {
  writing_ = true;
  Written written = Written::all;
  for (int round = 0; round < kRounds && written == Written::all && !lost_ && hasOutput();
       ++round) {
    if (sent_ == sending_.size()) {
      sending_.clear();
      sent_ = 0;
      std::swap(sending_, gathered_);
      room_.notifyAll();
    }
    mutex_.unlock();
    written = writeSending(mayWait);
    mutex_.lock();
  }
  writing_ = false;
  room_.notifyAll();
  if (mayWait && written == Written::all && hasOutput()) wakeReader();
}

Client::Channel::Written Client::Channel::writeSending(bool mayWait) {
  while (sent_ < sending_.size()) {
    const ssize_t count =
        ::send(socket_, sending_.data() + sent_, sending_.size() - sent_, MSG_NOSIGNAL);
    if (count >= 0) {
      sent_ += static_cast<std::size_t>(count);
    } else if (errno == EAGAIN && mayWait) {
      pollfd writable{socket_, POLLOUT, 0};
      ::poll(&writable, 1, -1);
    } else if (errno == EAGAIN) {
      return Written::some;
    } else if (errno != EINTR) {
      ::shutdown(socket_, SHUT_RDWR);  // the reader thread finds the end and says so
      return Written::failed;
    }
  }
  return Written::all;
}

void Client::Channel::wakeReader() const {
  const std::uint64_t one = 1;
  [[maybe_unused]] const ssize_t count = ::write(wake_, &one, sizeof one);
}

void Client::Channel::read() {
  std::optional<std::string> end;
  while (!end) {
    end = receive();
    if (!end) end = giveReplies();
  }
  ::shutdown(socket_, SHUT_RDWR);
  answerEverything(*end);
}

// Waits for bytes and takes them in. Returns why there will be no more.
std::optional<std::string> Client::Channel::receive() {
  if (begin_ == end_) begin_ = end_ = 0;
  if (end_ == received_.size()) {
    if (begin_ > 0) {
      std::memmove(received_.data(), received_.data() + begin_, end_ - begin_);
      end_ -= std::exchange(begin_, 0);
    } else {
      received_.resize(received_.size() * 2);
    }
  }
  for (;;) {
    const ssize_t count = ::recv(socket_, received_.data() + end_, received_.size() - end_, 0);
    if (count > 0) {
      end_ += static_cast<std::size_t>(count);
      return std::nullopt;
    }
    if (count == 0) return "The service has closed the connection.";
    if (errno == EAGAIN) {
      writeAndWait();
    } else if (errno != EINTR) {
      return std::string("The connection to the service broke: ") + std::strerror(errno) + ".";
    }
  }
}

// Sends what the replies gathered as far as that goes without waiting, then waits for the socket.
void Client::Channel::writeAndWait() {
  pollfd waited[2] = {{socket_, POLLIN, 0}, {wake_, POLLIN, 0}};
  {
    MutexLock lock(mutex_);
    if (!writing_ && hasOutput()) write(false);
    if (!writing_ && hasOutput()) waited[0].events |= POLLOUT;
  }
  ::poll(waited, 2, -1);
  if (waited[1].revents != 0) {
    std::uint64_t count = 0;
    [[maybe_unused]] const ssize_t read = ::read(wake_, &count, sizeof count);
  }
}

std::optional<std::string> Client::Channel::giveReplies() {
  for (;;) {
    const std::string_view bytes(received_.data() + begin_, end_ - begin_);
    if (bytes.empty()) return std::nullopt;
    switch (scanner_.scan(bytes)) {
      case MessagePackScanner::Progress::incomplete:
        return std::nullopt;
      case MessagePackScanner::Progress::fault:
        return "The service sent what is no reply: " + scanner_.fault();
      case MessagePackScanner::Progress::complete:
        break;
    }
    begin_ += scanner_.length();
    scanner_.reset();
    if (!giveReply(PayloadValue(bytes.data()))) return "The service sent what is no reply.";
  }
}

bool Client::Channel::giveReply(PayloadValue response) {
  constexpr std::int64_t kResponse = 1;
  if (response.kind() != PayloadValue::Kind::list || response.count() != 4) return false;
  auto item = response.items().begin();
  const auto kind = (*item).integer();
  const auto call = (*++item).integer();
  const PayloadValue error = *++item;
  const PayloadValue result = *++item;
  if (kind != kResponse || !call || !std::in_range<std::uint32_t>(*call)) return false;

  AnyReply reply;
  {
    MutexLock lock(mutex_);
    const auto found = pending_.find(static_cast<std::uint32_t>(*call));
    if (found == pending_.end()) return true;  // nobody waits for it any more
    reply = std::move(found->second);
    pending_.erase(found);
  }
  const auto give = [&]<class T>(const Reply<T>& to) {
    if (!error.isNil()) return to(ReadError(error));
    if (auto read = Read<T>(result)) return to(*std::move(read));
    to(Failure(Code::unexpectedReply, "The service's reply is not what this operation replies."));
  };
  std::visit(Overloaded{[](std::monostate) {}, give}, reply);
  return true;
}

// After the loss: answers what waits, and every call that still comes, until the client closes.
void Client::Channel::answerEverything(const std::string& reason) {
  MutexLock lock(mutex_);
  lost_ = true;
  room_.notifyAll();
  for (;;) {
    while (pending_.empty() && !closing_) changed_.wait(mutex_);
    if (pending_.empty()) return;
    std::vector<std::pair<std::uint32_t, AnyReply>> waiting(
        std::make_move_iterator(pending_.begin()), std::make_move_iterator(pending_.end()));
    pending_.clear();
    mutex_.unlock();
    std::sort(waiting.begin(), waiting.end(),
              [](const auto& one, const auto& other) { return one.first < other.first; });
    const auto give = [&reason]<class T>(const Reply<T>& to) {
      to(Failure(Code::connectionLost, reason));
    };
    for (const auto& [call, reply] : waiting) {
      std::visit(Overloaded{[](std::monostate) {}, give}, reply);
    }
    waiting.clear();
    mutex_.lock();
  }
}

}  // namespace quarvel
