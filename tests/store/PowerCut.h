#pragma once

#include <cstddef>
#include <map>
#include <random>
#include <string>
#include <vector>

#include "tests/Interposer.h"

namespace quarvel::testing {

/// Walks through a record of changes and makes images of the medium after a power cut. Owned by a
/// test; one thread.
///
/// An image holds all changes from before the beginning of a sync that has ended. Any other change
/// of a file may be missing, whether or not newer ones are there, and any part of a write, in
/// sectors of 512 bytes. The first few changes of names are there: journaling file systems keep
/// their order. After a failed sync the changes before it are never durable: the system has dropped
/// the pages that it could not write.
class PowerCut {
 public:
  using Change = Interposer::Change;

  explicit PowerCut(const std::vector<Change>& record) : record_(record), next_(record.begin()) {}

  /// Goes on to the moment after the next change; false at the end.
  bool advance();

  enum class Survival { everything, nothing, anything };
  /// Names and contents of the files.
  using Image = std::map<std::string, std::string>;
  [[nodiscard]] Image image(Survival survival, std::mt19937& random) const;
  /// The promise at this moment.
  [[nodiscard]] off_t promised() const { return promised_; }

 private:
  struct Pending {
    const Change* change;
    bool given_up = false;  // by a sync that failed
    bool safe = false;
  };
  struct File {
    std::string safe;
    std::vector<Pending> pending;
  };
  using Names = std::map<std::string, std::size_t>;

  void syncFile(File& file, const Change& sync) const;
  static void applyName(Names& names, const Change& change, std::size_t created);
  static void apply(std::string& content, const Change& change);
  static void applyTorn(std::string& content, const Change& change, std::mt19937& random);

  const std::vector<Change>& record_;
  std::vector<Change>::const_iterator next_;
  off_t promised_ = 0;
  std::vector<File> files_;
  Names names_;      // as the program sees them
  Names safeNames_;  // as they are on the medium
  std::vector<std::pair<const Change*, std::size_t>> pendingNames_;
};

}  // namespace quarvel::testing
