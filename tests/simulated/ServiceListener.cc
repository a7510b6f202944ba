#include "platform/ServiceListener.h"

#include <fmt/format.h>

#include <utility>

#include "base/MessagePack.h"
#include "tests/simulated/Simulation.h"

namespace quarvel {

namespace {

class RecordingReply final : public ReplySink {
 public:
  explicit RecordingReply(std::shared_ptr<RecordedCall> call) : call_(std::move(call)) {}

  void result(Value value) override {
    Simulation::current().note(fmt::format("reply {} {}", call_->method, JsonText(value)));
    call_->results.push_back(std::move(value));
  }
  void error(const Error& error) override { call_->results.emplace_back(error.description()); }

 private:
  const std::shared_ptr<RecordedCall> call_;
};

}  // namespace

class SimulatedConnection final : public ClientConnection,
                                  public std::enable_shared_from_this<SimulatedConnection> {
 public:
  SimulatedConnection(std::int32_t processIdentifier, std::size_t client)
      : processIdentifier_(processIdentifier),
        client_(client),
        queue_(Simulation::current().scheduler.makeQueue("connection", true)) {}

  [[nodiscard]] std::int32_t processIdentifier() const override { return processIdentifier_; }
  void setExportedInterface(const ExportedInterface& exportedInterface) override {
    interface_ = &exportedInterface;
  }
  void setExportedObject(std::shared_ptr<ExportedObject> object) override {
    object_ = std::move(object);
  }
  [[nodiscard]] std::shared_ptr<ExportedObject> exportedObject() const override { return object_; }
  void setInterruptionHandler(std::function<void()> handler) override {
    interruptionHandler_ = std::move(handler);
  }
  void setInvalidationHandler(std::function<void()> handler) override {
    invalidationHandler_ = std::move(handler);
  }
  void resume() override {}
  [[nodiscard]] std::string description() const override {
    return fmt::format("<ClientConnection {}>", processIdentifier_);
  }

  // On the connection's thread. Its first block is the question to the delegate, so calls follow.
  void perform(Block block) { Simulation::current().scheduler.enqueue(queue_, std::move(block)); }

  void receive(const std::shared_ptr<RecordedCall>& call, const std::string& arguments) {
    if (object_ == nullptr) return;
    note(Arrival::Kind::call, call);
    const ExportedMethod* method = interface_->find(call->method);
    if (method == nullptr) {
      call->fault = "unknown method " + call->method;
      return;
    }
    std::vector<PayloadValue> values;
    for (const PayloadValue value : PayloadValue(arguments.data()).items()) values.push_back(value);
    call->fault = method->invoke(*method, *object_, values, std::make_shared<RecordingReply>(call));
  }

  void end(bool interrupted) {
    const auto interruptionHandler = std::exchange(interruptionHandler_, nullptr);
    const auto invalidationHandler = std::exchange(invalidationHandler_, nullptr);
    if (invalidationHandler) note(Arrival::Kind::end);
    if (interrupted && interruptionHandler) interruptionHandler();
    if (invalidationHandler) invalidationHandler();
    object_.reset();
    Simulation::current().listener.drop(*this);
  }

  void note(Arrival::Kind kind, std::shared_ptr<const RecordedCall> call = nullptr) const {
    Simulation::current().arrivals.push_back({kind, client_, std::move(call)});
  }

 private:
  const std::int32_t processIdentifier_;
  const std::size_t client_;
  const std::shared_ptr<Scheduler::Queue> queue_;
  const ExportedInterface* interface_ = nullptr;
  std::shared_ptr<ExportedObject> object_;
  std::function<void()> interruptionHandler_;
  std::function<void()> invalidationHandler_;
};

SimulatedClient::SimulatedClient(const std::shared_ptr<SimulatedConnection>& connection)
    : connection_(connection) {}

SimulatedClient::Call SimulatedClient::call(std::string method, const List& arguments) {
  auto call = std::make_shared<RecordedCall>();
  call->method = std::move(method);
  call->arguments = arguments;
  std::string encoded;
  MessagePackWriter(encoded).value(Value(arguments));
  if (const auto connection = connection_.lock()) {
    connection->perform([weak = connection_, call, encoded = std::move(encoded)] {
      if (const auto serving = weak.lock()) serving->receive(call, encoded);
    });
  }
  return call;
}

void SimulatedClient::end(bool interrupted) {
  if (const auto connection = connection_.lock()) {
    connection->perform([weak = connection_, interrupted] {
      if (const auto serving = weak.lock()) serving->end(interrupted);
    });
  }
}

std::weak_ptr<ClientConnection> SimulatedClient::connection() const {
  return connection_;
}

SimulatedClient SimulatedListener::connect(std::int32_t processIdentifier) {
  const auto connection = connections_.emplace_back(
      std::make_shared<SimulatedConnection>(processIdentifier, clients_++));
  connection->perform([this, connection] {
    connection->note(Arrival::Kind::connection);
    if (!resumed_ || !delegate_->shouldAcceptNewConnection(*this, connection)) drop(*connection);
  });
  return SimulatedClient(connection);
}

void SimulatedListener::setDelegate(std::shared_ptr<ServiceListenerDelegate> delegate) {
  delegate_ = std::move(delegate);
}

void SimulatedListener::resume() {
  resumed_ = true;
}

void SimulatedListener::drop(const SimulatedConnection& connection) {
  std::erase_if(connections_, [&](const auto& held) { return held.get() == &connection; });
}

void SimulatedListener::release() {
  connections_.clear();
  delegate_.reset();
}

ServiceListener& ProcessServiceListener() {
  return Simulation::current().listener;
}

}  // namespace quarvel
