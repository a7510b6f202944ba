#pragma once

#include <cstdint>
#include <string>

#include "base/Mutex.h"

namespace quarvel::testing {

/// A SQLite file layer over the real one that counts what reaches the medium, and can be told to be
/// full or to stand still. One for all stores of a test; register it once.
class StoreVfs {
 public:
  static constexpr const char* kName = "quarvel-test";
  /// Registers the layer on first use; forgets all counts and faults.
  static StoreVfs& fresh();

  struct Counts {
    int commits = 0;   // transactions written to a write-ahead log
    int logSyncs = 0;  // syncs of a write-ahead log
    int refusedWrites = 0;
  };
  [[nodiscard]] Counts counts();
  /// Returns once that many syncs of a log, or refused writes, have been counted.
  void awaitLogSyncs(int atLeast);
  void awaitRefusedWrites(int atLeast);

  /// From now on writes fail as on a full disk, or succeed again.
  void setFull(bool full);
  /// From now on writes to a log wait, until released.
  void hold();
  void release();
  /// Returns once a write waits.
  void awaitHeld();

  // From the layer below.
  [[nodiscard]] bool admitWrite(bool isLog, bool isCommit);
  void synced(bool isLog);

 private:
  Mutex mutex_;
  ConditionVariable changed_;
  Counts counts_ QUARVEL_GUARDED_BY(mutex_);
  bool full_ QUARVEL_GUARDED_BY(mutex_) = false;
  bool hold_ QUARVEL_GUARDED_BY(mutex_) = false;
  int held_ QUARVEL_GUARDED_BY(mutex_) = 0;
};

}  // namespace quarvel::testing
