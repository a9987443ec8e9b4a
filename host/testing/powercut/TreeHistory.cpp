#include "host/testing/powercut/TreeHistory.h"

#include <algorithm>
#include <utility>

namespace velmora::mobile::xplat::cellar::test {

namespace {

using Change = TreeHistory::Change;
using Operation = TreeHistory::Operation;

void apply(const Change& change, Entries& entries) {
  if (change.node) {
    entries[change.name] = change.node;
  } else {
    entries.erase(change.name);
  }
}

// The names that a power cut leaves. What has moved is in one place only, whichever of its earlier moves were lost.
class NamesLeft {
 public:
  // What is durable in a directory is taken over with the first look at it.
  Entries& of(const Node& directory) {
    const auto [found, isNew] = directories_.try_emplace(&directory, directory.durable);
    if (isNew) {
      for (const auto& [name, node] : found->second) places_[node.get()] = {&directory, name};
    }
    return found->second;
  }

  void comesThrough(const Operation& operation) {
    const bool isRename = operation.size() > 1;
    for (const Change& change : operation) {
      if (change.node) {
        give(change);
      } else if (!isRename) {
        of(*change.directory).erase(change.name);
      }
    }
  }

 private:
  void give(const Change& change) {
    if (const auto place = places_.find(change.node.get()); place != places_.end()) {
      const auto& [directory, name] = place->second;
      Entries& before = of(*directory);
      const auto entry = before.find(name);
      if (entry != before.end() && entry->second == change.node) before.erase(entry);
    }
    of(*change.directory)[change.name] = change.node;
    places_[change.node.get()] = {change.directory.get(), change.name};
  }

  std::map<const Node*, Entries> directories_;
  std::map<const Node*, std::pair<const Node*, std::string>> places_;
};

void list(const Node& directory, const std::string& path, NamesLeft& names, Random& random,
          std::vector<Remains>& remains) {
  for (const auto& [name, node] : names.of(directory)) {
    if (directory.disregarded.count(name) != 0) continue;
    std::string here = path;
    here.append(path.empty() ? "" : "/").append(name);
    const bool isFile = node->kind == Node::Kind::File;
    remains.push_back(
        {here, node->kind, isFile ? node->content.afterPowerCut(random) : FileHistory::Bytes(), node->target});
    if (node->kind == Node::Kind::Directory) list(*node, here, names, random, remains);
  }
}

void syncBelow(Node& directory) {
  directory.durable = directory.entries;
  for (const auto& [name, node] : directory.entries) {
    node->content.sync();
    syncBelow(*node);
  }
}

}  // namespace

TreeHistory::TreeHistory() : root_(std::make_shared<Node>()) { root_->kind = Node::Kind::Directory; }

void TreeHistory::link(const NodePtr& directory, const std::string& name, const NodePtr& node) {
  perform({{directory, name, node}});
}

void TreeHistory::unlink(const NodePtr& directory, const std::string& name) { perform({{directory, name, nullptr}}); }

void TreeHistory::rename(const NodePtr& fromDirectory, const std::string& from, const NodePtr& toDirectory,
                         const std::string& to) {
  const NodePtr node = fromDirectory->entries.at(from);
  perform({{fromDirectory, from, nullptr}, {toDirectory, to, node}});
}

// An earlier operation on a name that a durable one has changed has become durable, or it would undo that one.
void TreeHistory::sync(const NodePtr& directory) {
  std::set<std::pair<const Node*, std::string>> names;
  const auto isDurable = [&](const Change& change) {
    return change.directory == directory || names.count({change.directory.get(), change.name}) != 0;
  };
  std::vector<Operation> remaining;
  std::vector<Operation> done;
  for (auto operation = pending_.rbegin(); operation != pending_.rend(); ++operation) {
    const bool isDone = std::any_of(operation->begin(), operation->end(), isDurable);
    if (isDone) {
      for (const Change& change : *operation) names.emplace(change.directory.get(), change.name);
    }
    (isDone ? done : remaining).push_back(std::move(*operation));
  }
  for (auto operation = done.rbegin(); operation != done.rend(); ++operation) {
    for (const Change& change : *operation) apply(change, change.directory->durable);
  }
  std::reverse(remaining.begin(), remaining.end());
  pending_ = std::move(remaining);
}

void TreeHistory::syncAll() {
  pending_.clear();
  syncBelow(*root_);
}

std::vector<Remains> TreeHistory::afterPowerCut(Random& random) const {
  NamesLeft names;
  const Random::Luck luck = random.luck();
  for (const Operation& operation : pending_) {
    for (const Change& change : operation) names.of(*change.directory);
    if (random.succeeds(luck)) names.comesThrough(operation);
  }
  std::vector<Remains> remains;
  list(*root_, "", names, random, remains);
  return remains;
}

void TreeHistory::perform(Operation operation) {
  for (const Change& change : operation) apply(change, change.directory->entries);
  pending_.push_back(std::move(operation));
}

}  // namespace velmora::mobile::xplat::cellar::test
