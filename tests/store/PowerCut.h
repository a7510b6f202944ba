#pragma once

#include <cstddef>
#include <map>
#include <random>
#include <string>
#include <vector>

#include "tests/store/FileCalls.h"

namespace quarvel::testing {

/// Walks through a record of changes and tells what could be on the medium if power were cut then.
///
/// What was there when a sync began that has ended is there. Of a file's other changes each is
/// there or not, whatever is newer, and of a write any part, in sectors of 512 bytes. Of the
/// changes to names the first few are there, as journaling file systems keep them in order. A sync
/// that failed makes nothing safe, and no later one either: the system has given up what it could
/// not write.
class PowerCut {
 public:
  using Change = FileCalls::Change;

  /// With `syncs` false, nothing was ever synced.
  PowerCut(const std::vector<Change>& record, bool syncs = true)
      : record_(record), next_(record.begin()), syncs_(syncs) {}

  /// Goes on to the moment after the next change; false at the end.
  bool advance();

  enum class Survival { everything, nothing, anything };
  /// Names and contents of the files.
  using Image = std::map<std::string, std::string>;
  [[nodiscard]] Image image(Survival survival, std::mt19937& random) const;
  /// What is promised at this moment.
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
  const bool syncs_;
  off_t promised_ = 0;
  std::vector<File> files_;
  Names names_;      // as the program sees them
  Names safeNames_;  // as they are on the medium
  std::vector<std::pair<const Change*, std::size_t>> pendingNames_;
};

}  // namespace quarvel::testing
