#pragma once

#include <atomic>
#include <cstddef>
#include <exception>

#include "keyvalue/Chain.h"
#include "keyvalue/StoreContext.h"

namespace velmora::mobile::xplat::cellar {

// An operation of the work queue that changes the manifest. It runs alone, or step by step in a group of which all
// changes share a transaction (GroupCommit).
class ManifestChange : public Chain<ManifestChange>::Link {
 public:
  ManifestChange() = default;
  ManifestChange(const ManifestChange&) = delete;
  ManifestChange& operator=(const ManifestChange&) = delete;
  virtual ~ManifestChange() = default;

  // True for the first who asks: to be run by the caller.
  bool take() { return !isTaken_.exchange(true); }

  // Of the value that it puts into the manifest.
  virtual std::size_t bytes() const { return 0; }

  // All of it. The manifest may have been changed and taken back before.
  virtual void runAlone() = 0;

  // The statements, within the transaction. When it throws, the whole transaction is rolled back.
  virtual void change(const StoreLock& lock) = 0;

  // The transaction is complete. Delivers nothing. What it throws becomes the failure.
  virtual void note(const StoreLock& lock) = 0;

  // Deletes the file of what was removed, on this thread, unless the store is closed by then. Does not throw. An
  // invalidation that blocks waits for it.
  virtual void deleteFile() {}

  // The rest, with no lock held: hands on, or fulfils the promise, with the failure if there is one.
  virtual void finish() = 0;

  std::exception_ptr failure;

 private:
  std::atomic<bool> isTaken_{false};
};

}  // namespace velmora::mobile::xplat::cellar
