#include "platform/ServiceListener.h"

#include <fmt/format.h>

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
        queue_(TheScheduler().makeQueue("connection", true)) {}
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

  /// Runs `action` on the connection's thread: first the question to the delegate, then calls.
  void perform(std::function<void(SimulatedConnection&)> action) {
    TheScheduler().enqueue(queue_, [weak = weak_from_this(), action = std::move(action)] {
      if (const auto serving = weak.lock()) action(*serving);
    });
  }
  void receive(const std::shared_ptr<RecordedCall>& call) {
    if (object_ == nullptr) return;
    note(Arrival::Kind::call, call);
    std::string encoded;
    MessagePackWriter(encoded).value(Value(call->arguments));
    std::vector<PayloadValue> values;
    for (const PayloadValue value : PayloadValue(encoded.data()).items()) values.push_back(value);
    const ExportedMethod& method = *interface_->find(call->method);
    call->fault = method.invoke(method, *object_, values, std::make_shared<RecordingReply>(call));
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
  const auto call =
      std::make_shared<RecordedCall>(RecordedCall{std::move(method), arguments, {}, {}});
  if (const auto connection = connection_.lock()) {
    connection->perform([call](auto& serving) { serving.receive(call); });
  }
  return call;
}

void SimulatedClient::end(bool interrupted) {
  if (const auto connection = connection_.lock()) {
    connection->perform([interrupted](auto& serving) { serving.end(interrupted); });
  }
}

SimulatedClient SimulatedListener::connect(std::int32_t processIdentifier) {
  const auto connection = connections_.emplace_back(
      std::make_shared<SimulatedConnection>(processIdentifier, clients_++));
  connection->perform([this](auto& fresh) {
    fresh.note(Arrival::Kind::connection);
    if (!resumed_ || !delegate_->shouldAcceptNewConnection(*this, fresh.shared_from_this())) {
      drop(fresh);
    }
  });
  return SimulatedClient(connection);
}

void SimulatedListener::drop(const SimulatedConnection& connection) {
  std::erase_if(connections_, [&](const auto& held) { return held.get() == &connection; });
}

ServiceListener& ProcessServiceListener() {
  return Simulation::current().listener;
}

void SimulatedListener::release() {
  connections_.clear();
  delegate_.reset();
}

}  // namespace quarvel
