#include "system/Status.h"

#include <fmt/format.h>

namespace quarvel {

namespace {

/// Adds a part's error, with the part's name in front.
void collectProblem(List& problems, const std::string& name, const Dictionary& part) {
  const Value* error = part.find("error");
  if (error == nullptr || error->string() == nullptr) return;
  problems.emplace_back(fmt::format("{}: {}", name, *error->string()));
}

std::string nameOf(const Dictionary& backend) {
  const Value* name = backend.find("name");
  return name != nullptr && name->string() != nullptr ? *name->string() : "backend";
}

}  // namespace

void Status::add(Describe describe) {
  const MutexLock lock(mutex_);
  top_.push_back(std::move(describe));
}

void Status::addSection(std::string name, Describe describe) {
  const MutexLock lock(mutex_);
  sections_.emplace_back(std::move(name), std::move(describe));
}

void Status::addBackend(Describe describe) {
  const MutexLock lock(mutex_);
  backends_.push_back(std::move(describe));
}

Dictionary Status::describe() const {
  // Described without the lock: a description may take long, or add another.
  std::vector<Describe> top;
  Sections sections;
  std::vector<Describe> backends;
  {
    const MutexLock lock(mutex_);
    top = top_;
    sections = sections_;
    backends = backends_;
  }
  List problems;
  Dictionary parts;
  for (const Describe& describe : top) parts.merge(describe());
  for (const auto& [name, describe] : sections) {
    Dictionary part = describe();
    collectProblem(problems, name, part);
    parts.set(name, std::move(part));
  }
  List entries;
  for (const Describe& describe : backends) {
    Dictionary part = describe();
    collectProblem(problems, nameOf(part), part);
    entries.emplace_back(std::move(part));
  }
  parts.set("backends", std::move(entries));
  Dictionary status{{"healthy", problems.empty()}, {"problems", std::move(problems)}};
  status.merge(parts);
  return status;
}

}  // namespace quarvel
