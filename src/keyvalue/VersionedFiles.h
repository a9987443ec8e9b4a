#pragma once

#include <cstdint>
#include <filesystem>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "PersistentKeyValueStore.h"
#include "keyvalue/StoreContext.h"
#include "keyvalue/VersionedName.h"

namespace velmora::mobile::xplat::cellar {

// The files of a safe store: one for each value that was ever written under a key, of which at most one is named by a
// record. What else is found at start was left behind by a process that was killed, or by a manifest that has lost its
// rows. Any thread may call.
class VersionedFiles {
 public:
  // A file as it was found, in the order of their numbers.
  struct Found {
    std::string name;
    VersionedName version;
  };

  struct Written {
    std::string name;
    std::uint32_t size;
    std::uint32_t checksum;
  };

  explicit VersionedFiles(StoreContext& context) : context_(context) {}

  // Takes stock of the directory, on the first call that can. In a synced store, makes the directory outlive a power
  // cut. Throws what the file system throws.
  void takeStock();

  // Writes a value into a file of its own. Throws what the file system, or the writer, throws: nothing is left then.
  Written write(const std::string& key, const std::vector<unsigned char>& value);
  Written write(const std::string& key, const PersistentKeyValueStore::Writer& writer);

  // A record names a file of that number: those to come are greater.
  void noteNumber(std::uint64_t number);

  // Throws when it cannot be told at the moment.
  bool exists(const std::string& name) const;

  // The store's own, which somebody may have removed. In a synced store it outlives a power cut.
  void createDirectory();

  // Makes a file that was written, and the names of all, outlive a power cut. Of several files each is begun first.
  void beginSync(const std::string& name);
  void sync(const std::string& name);
  void syncDirectory();

  // What is in the directory now of what was there at start.
  std::vector<Found> found();

  // Files of writers that did not finish, at start.
  std::vector<std::string> unfinished();

  // Bytes of a file that holds what its name says; empty for another. Throws when it cannot be read at the moment.
  std::optional<std::uint32_t> sizeIfIntact(const Found& file) const;

  // Of a value that lies in the file at `path`, and its size in bytes. Throws when it cannot be read at the moment.
  std::uint32_t checksumOf(const std::string& key, const std::string& path, std::uint64_t* size = nullptr) const;

 private:
  std::uint64_t nextNumber();
  std::vector<std::string> namesInDirectory() const;
  std::string pathOf(const std::string& name) const;

  StoreContext& context_;
  std::mutex mutex_;  // guards the rest
  bool hasTakenStock_ = false;
  std::uint64_t next_ = 1;      // number
  std::uint64_t firstOwn_ = 1;  // that this object gives out
};

// Links are not followed. Throws when it cannot be told: what is only out of reach at the moment must not be taken for
// missing.
std::filesystem::file_type typeOfFile(const std::string& path);

}  // namespace velmora::mobile::xplat::cellar
