#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <string>
#include <vector>

#include "Format.h"
#include "demo/Application.h"
#include "demo/SourceFiles.h"

namespace velmora::mobile::xplat::cellar::tools {

class Console;

// A day in the life of an application's storage, scene by scene. Each scene does something with the application, says
// what has happened, and checks it: against what the application has noted of its own data, and against the files on
// disk. What fails is printed and counted.
class Story {
 public:
  // `root` is absolute; `console` and `source` outlive this.
  Story(Console& console, const SourceFiles& source, const std::string& root)
      : console_(console), source_(source), root_(root), app_(root) {}

  // All scenes, up to the first that cannot be played to its end, and then tables of what has come of it.
  void play();

  std::size_t passed() const { return passed_; }
  std::size_t failed() const { return failed_; }

 private:
  static constexpr std::size_t kPicture = 256U << 10U;
  static constexpr std::size_t kSmallPicture = 4U << 10U;

  struct Note {
    std::uint64_t bytes;
    std::size_t digest;
  };
  // What the application has noted of a store.
  struct Record {
    std::map<std::string, Note> contents;  // what it should hold, by key or by the name of the file
    TreeSize fullest;
    std::size_t stored = 0;  // values; and what has come of the requests for them
    std::size_t hits = 0;
    std::size_t misses = 0;
  };

  // --- The scenes (Scenes.cpp) ---

  void startFirst();
  void fillDirectories();
  void measure();
  void evictCovers();
  void storeByKey();
  void fetchByKey();
  void pruneCaches();
  void findAgain();
  void expireThumbnails();
  void clearThumbnails();
  void updateApplication();
  void changeUser();
  void trashDownloads();
  void cleanse();
  void emptyTrash();
  void logOut();

  // --- What they are made of ---

  bool playScene(const std::string& title, void (Story::*scene)());
  void start(const std::string& release, const std::string& user);
  void restart() { start(app_.release(), app_.user()); }
  void fillEmptyDirectories(std::size_t mostFiles, std::size_t covers);
  void writeFile(const std::string& store, const std::string& name, const Bytes& contents);
  std::size_t storeFiles();
  void storeUntilOver(std::uint64_t limit, const std::string& store);
  TreeSize forget(const std::string& store);
  TreeSize forgetSession();
  std::size_t forgetMissing(const std::string& store);

  // Both are finished, and what is fetched is checked, by `finishRequests` at the latest.
  void store(const std::string& store, const std::string& key, const Bytes& contents);
  void fetch(const std::string& store, const std::string& key);
  void addRequest(std::function<void()> finish);
  void finishRequests();

  // --- Checks ---

  void check(const std::string& what, const std::string& expected, const std::string& found);
  void check(const std::string& what, bool isTrue) { check(what, "yes", isTrue ? "yes" : "no"); }
  void check(const std::string& what, std::uint64_t expected, std::uint64_t found) {
    check(what, std::to_string(expected), std::to_string(found));
  }
  void checkFetched(const std::string& store, const std::string& key,
                    const PersistentKeyValueStore::FetchResult* found);
  void checkEverything();
  void checkDirectories();
  void checkEvents(const std::string& type, const std::multimap<std::string, std::uint64_t>& sizes);

  // --- What is known ---

  void noteFullest();
  TreeSize sizeOf(const std::string& store);  // as noted
  std::vector<std::string> keysOf(const std::string& store);
  void printStores();
  void printEvents() const;

  Console& console_;
  const SourceFiles& source_;
  const std::string root_;
  Application app_;
  std::map<std::string, Record> records_;        // by store
  std::vector<std::function<void()>> underWay_;  // waits for a request and checks what has come of it
  std::size_t passed_ = 0;
  std::size_t failed_ = 0;
};

}  // namespace velmora::mobile::xplat::cellar::tools
