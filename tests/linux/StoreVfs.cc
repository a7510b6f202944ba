#include "tests/linux/StoreVfs.h"

#include <sqlite3.h>

#include <cstring>

namespace quarvel::testing {

namespace {

constexpr int kFrameHeadBytes = 24;

struct File {
  sqlite3_file base;
  bool isLog;
  sqlite3_file* real;
};

StoreVfs& Instance() {
  static StoreVfs instance;
  return instance;
}

File* Self(sqlite3_file* file) {
  return reinterpret_cast<File*>(file);
}
sqlite3_file* Real(sqlite3_file* file) {
  return Self(file)->real;
}

int Write(sqlite3_file* file, const void* bytes, int count, sqlite3_int64 offset) {
  const bool isLog = Self(file)->isLog;
  // The head of a frame holds, for the last of a transaction, the size of the database after it.
  const auto* head = static_cast<const char*>(bytes);
  const bool isCommit =
      isLog && count == kFrameHeadBytes && std::memcmp(head + 4, "\0\0\0\0", 4) != 0;
  if (!Instance().admitWrite(isLog, isCommit)) return SQLITE_FULL;
  return Real(file)->pMethods->xWrite(Real(file), bytes, count, offset);
}

int Sync(sqlite3_file* file, int flags) {
  Instance().synced(Self(file)->isLog);
  return Real(file)->pMethods->xSync(Real(file), flags);
}

int Close(sqlite3_file* file) {
  return Real(file)->pMethods == nullptr ? SQLITE_OK : Real(file)->pMethods->xClose(Real(file));
}

template <auto Method, class... Arguments>
int Forward(sqlite3_file* file, Arguments... arguments) {
  return (Real(file)->pMethods->*Method)(Real(file), arguments...);
}

void Barrier(sqlite3_file* file) {
  Real(file)->pMethods->xShmBarrier(Real(file));
}

constexpr sqlite3_io_methods kMethods{
    .iVersion = 2,
    .xClose = Close,
    .xRead = Forward<&sqlite3_io_methods::xRead>,
    .xWrite = Write,
    .xTruncate = Forward<&sqlite3_io_methods::xTruncate>,
    .xSync = Sync,
    .xFileSize = Forward<&sqlite3_io_methods::xFileSize>,
    .xLock = Forward<&sqlite3_io_methods::xLock>,
    .xUnlock = Forward<&sqlite3_io_methods::xUnlock>,
    .xCheckReservedLock = Forward<&sqlite3_io_methods::xCheckReservedLock>,
    .xFileControl = Forward<&sqlite3_io_methods::xFileControl>,
    .xSectorSize = Forward<&sqlite3_io_methods::xSectorSize>,
    .xDeviceCharacteristics = Forward<&sqlite3_io_methods::xDeviceCharacteristics>,
    .xShmMap = Forward<&sqlite3_io_methods::xShmMap>,
    .xShmLock = Forward<&sqlite3_io_methods::xShmLock>,
    .xShmBarrier = Barrier,
    .xShmUnmap = Forward<&sqlite3_io_methods::xShmUnmap>,
    .xFetch = nullptr,
    .xUnfetch = nullptr,
};

int Open(sqlite3_vfs* vfs, sqlite3_filename name, sqlite3_file* file, int flags, int* outFlags) {
  auto* below = static_cast<sqlite3_vfs*>(vfs->pAppData);
  File* self = Self(file);
  self->isLog = (flags & SQLITE_OPEN_WAL) != 0;
  self->real = reinterpret_cast<sqlite3_file*>(self + 1);
  const int result = below->xOpen(below, name, self->real, flags, outFlags);
  self->base.pMethods = self->real->pMethods == nullptr ? nullptr : &kMethods;
  return result;
}

void Register() {
  static sqlite3_vfs layer = [] {
    sqlite3_vfs* below = sqlite3_vfs_find(nullptr);
    sqlite3_vfs made = *below;
    made.szOsFile = static_cast<int>(sizeof(File)) + below->szOsFile;
    made.zName = StoreVfs::kName;
    made.pAppData = below;
    made.xOpen = Open;
    return made;
  }();
  sqlite3_vfs_register(&layer, 0);
}

}  // namespace

StoreVfs& StoreVfs::fresh() {
  Register();
  StoreVfs& vfs = Instance();
  MutexLock lock(vfs.mutex_);
  vfs.counts_ = {};
  vfs.full_ = vfs.hold_ = false;
  return vfs;
}

StoreVfs::Counts StoreVfs::counts() {
  MutexLock lock(mutex_);
  return counts_;
}

void StoreVfs::awaitLogSyncs(int atLeast) {
  MutexLock lock(mutex_);
  while (counts_.logSyncs < atLeast) changed_.wait(mutex_);
}

void StoreVfs::awaitRefusedWrites(int atLeast) {
  MutexLock lock(mutex_);
  while (counts_.refusedWrites < atLeast) changed_.wait(mutex_);
}

void StoreVfs::setFull(bool full) {
  MutexLock lock(mutex_);
  full_ = full;
}

void StoreVfs::hold() {
  MutexLock lock(mutex_);
  hold_ = true;
}

void StoreVfs::release() {
  MutexLock lock(mutex_);
  hold_ = false;
  changed_.notifyAll();
}

void StoreVfs::awaitHeld() {
  MutexLock lock(mutex_);
  while (held_ == 0) changed_.wait(mutex_);
}

bool StoreVfs::admitWrite(bool isLog, bool isCommit) {
  MutexLock lock(mutex_);
  ++held_;
  changed_.notifyAll();
  while (isLog && hold_) changed_.wait(mutex_);
  --held_;
  if (full_) ++counts_.refusedWrites;
  if (!full_ && isCommit) ++counts_.commits;
  changed_.notifyAll();
  return !full_;
}

void StoreVfs::synced(bool isLog) {
  MutexLock lock(mutex_);
  if (isLog) ++counts_.logSyncs;
  changed_.notifyAll();
}

}  // namespace quarvel::testing
