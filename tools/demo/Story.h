#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <optional>
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
  Story(Console& console, const SourceFiles& source, const std::string& root);

  // All scenes, up to the first that cannot be played to its end, and then tables of what has come of it.
  void play();

  std::size_t passed() const { return passed_; }
  std::size_t failed() const { return failed_; }

 private:
  // A value on its way into a store: a source file as it is, or a picture made of it.
  struct Value {
    std::string key;
    std::size_t file;              // its number
    std::size_t pictureBytes = 0;  // 0: the file as it is
    std::optional<int> second{};   // of the video that it is a chunk of
  };
  // What the application has noted of a value that it has stored.
  struct Note {
    std::uint64_t bytes;
    std::size_t digest;
  };
  // What has come of the requests to a store with keys.
  struct Requests {
    std::size_t stored = 0;
    std::size_t hits = 0;
    std::size_t misses = 0;
  };
  using Values = std::map<std::string, std::vector<Value>>;  // by store
  using Notes = std::map<std::string, Note>;                 // by key
  struct Scene {
    const char* title;
    void (Story::*play)();
  };

  // --- The scenes (Scenes.cpp) ---

  static const std::vector<Scene>& scenes();
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

  bool playScene(const Scene& scene);
  void start(const std::string& release, const std::string& user);
  void restart();
  void fillEmptyDirectories(std::size_t mostFiles, std::uint64_t coversPercent);
  void copyFile(const std::string& path, const Bytes& contents);
  Values placeFiles() const;
  void store(const std::string& store, const std::vector<Value>& values);
  void fetch(const std::string& store, const std::vector<std::string>& keys);
  std::size_t fetchAll();
  std::size_t dropMissing(const std::string& store);
  void forget(const StoreDefinition& store);
  TreeSize forgetSession();
  void storeUntilOver(std::uint64_t limit, const std::string& store, std::uint64_t others);

  // --- Checks ---

  void check(const std::string& what, bool isTrue);
  void check(const std::string& what, std::uint64_t expected, std::uint64_t found);
  void fail(const std::string& what, const std::string& expected, const std::string& found);
  void checkResult(const std::string& store, const std::string& key, const PersistentKeyValueStore::FetchResult* found);
  void checkEverything();
  void checkGone(const std::vector<std::string>& directories);
  void checkEvents(const std::string& type, const std::map<std::string, std::uint64_t>& sizes);

  // --- What is known ---

  TreeSize sizeOf(const std::string& store);  // as noted
  std::vector<std::string> keysOf(const std::string& store);
  std::vector<JsonValue> eventsNamed(const std::string& name) const;
  std::vector<std::string> sessionDirectories();
  std::size_t requests(std::size_t Requests::*which) const;
  Bytes contentsOf(const Value& value) const;
  std::string below(const std::string& path) const;
  void noteSizes();
  void printStores();
  void printEvents();

  Console& console_;
  const SourceFiles& source_;
  const std::string root_;
  Application app_;
  std::map<std::string, TreeSize> directories_;  // by store: what the unmanaged ones should hold
  std::map<std::string, Notes> notes_;           // by store: what those with keys should hold
  std::map<std::string, Requests> requests_;     // by store with keys
  std::map<std::string, TreeSize> fullest_;      // by store
  std::size_t passed_ = 0;
  std::size_t failed_ = 0;
};

}  // namespace velmora::mobile::xplat::cellar::tools
