#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include <cellar/host/testing/powercut/FileHistory.h>
#include <cellar/host/testing/powercut/Random.h>

namespace velmora::mobile::xplat::cellar::test {

struct Node;
using NodePtr = std::shared_ptr<Node>;
using Entries = std::map<std::string, NodePtr>;

// A file, a directory or a link, whatever its name is and whether it has one.
struct Node {
  enum class Kind { File, Directory, Link };

  Kind kind = Kind::File;
  std::uint64_t inode = 0;  // the real one's

  // Of a file. The date is that of the last change that was recorded, in nanoseconds.
  FileHistory content;
  std::int64_t changed = 0;
  bool isDatabase = false;  // written by SQLite, in parts

  // Of a directory: what it has now, what of it is durable, and names that never outlive a power cut.
  Entries entries;
  Entries durable;
  std::set<std::string> disregarded;

  std::string target;  // of a link
};

// What there may be after a power cut: an entry below the root. Directories come before what they contain.
struct Remains {
  std::string path;  // relative to the root
  Node::Kind kind;
  FileHistory::Bytes content;
  std::string target;
};

// The names in a tree of directories: what they are, what of them is durable, and what has happened to them since their
// directories were last synced. Touches no disk. Not thread-safe.
class TreeHistory {
 public:
  TreeHistory();

  const NodePtr& root() const { return root_; }

  // Gives a node a name, and takes that name from what had it.
  void link(const NodePtr& directory, const std::string& name, const NodePtr& node);

  void unlink(const NodePtr& directory, const std::string& name);

  // Atomic: after a power cut the node has either its old name or the new one. Whoever had the new one has lost it.
  void rename(const NodePtr& fromDirectory, const std::string& from, const NodePtr& toDirectory, const std::string& to);

  // Makes all changes of the names in one directory durable. One of a rename from or to another directory is the whole
  // rename.
  void sync(const NodePtr& directory);

  // Makes all there is durable.
  void syncAll();

  std::vector<Remains> afterPowerCut(Random& random) const;

  struct Change {
    NodePtr directory;
    std::string name;
    NodePtr node;  // null: the name has gone
  };

  // What comes through as a whole or not at all: one change, or the two of a rename.
  using Operation = std::vector<Change>;

 private:
  void perform(Operation operation);

  NodePtr root_;
  std::vector<Operation> pending_;
};

}  // namespace velmora::mobile::xplat::cellar::test
