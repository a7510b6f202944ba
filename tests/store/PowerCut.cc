#include "tests/store/PowerCut.h"

#include <algorithm>
#include <filesystem>

namespace quarvel::testing {

namespace {

using Kind = Interposer::Change::Kind;

constexpr std::size_t kSector = 512;

/// Shared memory, which never reaches a medium.
bool IsSharedMemory(const std::string& path) {
  return path.ends_with("-shm");
}

}  // namespace

bool PowerCut::advance() {
  if (next_ == record_.end()) return false;
  const Change& change = *next_++;
  if (IsSharedMemory(change.path)) return true;
  switch (change.kind) {
    case Kind::mark:
      promised_ = change.offset;
      break;
    case Kind::create:
      files_.emplace_back();
      [[fallthrough]];
    case Kind::rename:
    case Kind::remove:
      pendingNames_.emplace_back(&change, files_.size() - 1);
      applyName(names_, change, files_.size() - 1);
      break;
    case Kind::write:
    case Kind::truncate:
      files_[names_.at(change.path)].pending.push_back({&change});
      break;
    case Kind::sync:
      if (const auto file = names_.find(change.path); file != names_.end()) {
        syncFile(files_[file->second], change);
      } else if (!change.failed) {
        safeNames_ = names_;
        pendingNames_.clear();
      }
      break;
  }
  return true;
}

void PowerCut::syncFile(File& file, const Change& sync) const {
  for (Pending& pending : file.pending) {
    if (pending.change >= record_.data() + sync.begun) break;
    if (sync.failed && !pending.safe) pending.given_up = true;
    if (!sync.failed && !pending.given_up) pending.safe = true;
  }
  const auto firstUnsafe = std::ranges::find(file.pending, false, &Pending::safe);
  std::for_each(file.pending.begin(), firstUnsafe,
                [&file](const Pending& pending) { apply(file.safe, *pending.change); });
  file.pending.erase(file.pending.begin(), firstUnsafe);
}

PowerCut::Image PowerCut::image(Survival survival, std::mt19937& random) const {
  const auto oneOf = [&random](std::size_t count) { return random() % count; };
  Names names = safeNames_;
  std::size_t kept = pendingNames_.size();
  if (survival == Survival::nothing) kept = 0;
  if (survival == Survival::anything) kept = oneOf(kept + 1);
  for (std::size_t i = 0; i < kept; ++i) {
    applyName(names, *pendingNames_[i].first, pendingNames_[i].second);
  }
  Image image;
  for (const auto& [name, number] : names) {
    const File& file = files_[number];
    std::string content = file.safe;
    // Some of the time, one file is all there and another is not.
    const std::size_t tendency = oneOf(4);
    for (const Pending& pending : file.pending) {
      const std::size_t fate = tendency < 2 ? tendency : oneOf(3);
      if (pending.safe || survival == Survival::everything ||
          (survival == Survival::anything && fate == 1)) {
        apply(content, *pending.change);
      } else if (survival == Survival::anything && fate == 2) {
        applyTorn(content, *pending.change, random);
      }
    }
    image.emplace(std::filesystem::path(name).filename(), std::move(content));
  }
  return image;
}

void PowerCut::applyName(Names& names, const Change& change, std::size_t created) {
  switch (change.kind) {
    case Kind::create:
      names[change.path] = created;
      break;
    case Kind::rename:
      if (const auto old = names.find(change.path); old != names.end()) {
        const std::size_t number = old->second;
        names.erase(old);
        names[change.text] = number;
      }
      break;
    default:
      names.erase(change.path);
  }
}

void PowerCut::apply(std::string& content, const Change& change) {
  const auto offset = static_cast<std::size_t>(change.offset);
  if (change.kind == Kind::truncate) return content.resize(offset);
  content.resize(std::max(content.size(), offset + change.text.size()));
  content.replace(offset, change.text.size(), change.text);
}

void PowerCut::applyTorn(std::string& content, const Change& change, std::mt19937& random) {
  if (change.kind == Kind::truncate) return;
  const auto begin = static_cast<std::size_t>(change.offset);
  for (std::size_t at = begin; at < begin + change.text.size();) {
    const std::size_t end = std::min((at / kSector + 1) * kSector, begin + change.text.size());
    if (random() % 2 == 0) {
      content.resize(std::max(content.size(), end));
      content.replace(at, end - at, change.text, at - begin, end - at);
    }
    at = end;
  }
}

}  // namespace quarvel::testing
