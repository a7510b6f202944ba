#pragma once

#include <chrono>
#include <cstddef>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <variant>

#include <quarvel/client.hpp>

#include "base/Error.h"
#include "base/Mutex.h"
#include "base/Value.h"

/// A script of calls: JSON Lines, an object a line. Empty lines and lines that begin with "#" are
/// skipped.
namespace quarvel::script {

/// {"call": "<full keyword name>", "args": […], "wait": true or false}
struct Call {
  std::string operation;  // not checked: the service knows its operations
  List arguments;         // as written, for printing
  List values;  // as sent: {"$date": "<RFC 3339>"} is a date, {"$bytes": "<base64>"} bytes
  bool wait;    // for the reply, before the next line; by default not for a start
};

/// {"sleep": seconds}
struct Sleep {
  std::chrono::duration<double> duration;  // seconds, 0 or more
};

/// {"expect": value}: the expected last reply of the calls that were waited for, as it was printed:
/// a result, or an error's dictionary. Other replies, such as a start's, do not count.
struct Expect {
  Value value;
};

using Action = std::variant<Call, Sleep, Expect>;

/// An action with its place in the file, for the text of a fault.
struct Step {
  std::size_t line;  // counted from 1
  Action action;
};

/// Reads one line of a script. Errors: domain "quarvel.script" or "quarvel.json", with a reason.
[[nodiscard]] Result<Action> Parse(std::string_view line);

/// Whether a line is empty or a comment, and so no step.
[[nodiscard]] bool IsSkipped(std::string_view line);

}  // namespace quarvel::script

namespace quarvel {

/// Plays a script on one connection and prints each reply as a JSON line when it arrives. Owned by
/// one command. The functions are for one thread; replies come on the client's thread.
class Player {
 public:
  /// Takes the connected client over.
  explicit Player(Client client);
  /// Closes the connection; the errors that this causes are not printed.
  ~Player();
  Player(const Player&) = delete;
  Player& operator=(const Player&) = delete;

  /// Errors: an expectation that is not met, a connection that is lost.
  [[nodiscard]] Outcome play(const script::Step& step);
  /// Waits for the outstanding replies of all calls. For the start of a session that the script has
  /// stopped it waits ten seconds at most.
  [[nodiscard]] Outcome finish();

 private:
  /// The state that replies change; shared with the callbacks, which may outlive the player.
  struct Replies {
    Mutex mutex;
    ConditionVariable changed;
    std::size_t outstanding QUARVEL_GUARDED_BY(mutex) = 0;         // without starts
    std::multiset<std::int64_t> starts QUARVEL_GUARDED_BY(mutex);  // sessions, without a reply yet
    std::optional<Value> last QUARVEL_GUARDED_BY(mutex);           // of those waited for
    bool closing QUARVEL_GUARDED_BY(mutex) = false;
  };

  // Each plays one step. Errors as `play`.
  [[nodiscard]] Outcome playCall(const script::Call& call);
  [[nodiscard]] Outcome playExpect(const script::Expect& expect);
  [[nodiscard]] Outcome checkConnection() const;

  const std::shared_ptr<Replies> replies_ = std::make_shared<Replies>();
  std::set<std::int64_t> stopped_;  // sessions whose start is due to be answered
  bool killed_ = false;             // the script has ended the service: the loss is no error
  Client client_;
};

}  // namespace quarvel
