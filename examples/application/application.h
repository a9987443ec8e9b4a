// What the two programs beside this one have in common: the document, and a day in the life of the application. Each
// includes it behind its class `Storage`.
#pragma once

#include <filesystem>
#include <fstream>
#include <iostream>
#include <string>

inline bool check(bool isRight, const char* what) {
  if (!isRight) std::cerr << "Wrong: " << what << "\n";
  return isRight;
}

template <class Storage> bool useForADay(const std::string& directory) {
  Storage storage(directory);
  storage.logIn("ada");
  storage.keepDraft("letter", "Dear Charles");
  storage.keepThumbnail("https://a.example/engine.jpg", {0xff, 0xd8});
  std::ofstream(storage.webFolder() + "/page.html") << "hello";
  return check(storage.draft("letter") == "Dear Charles", "the draft that was kept is not there");
}

template <class Storage> bool useOnTheNextDay(const std::string& directory) {
  Storage storage(directory);
  storage.logIn("ada");
  bool isRight = check(storage.draft("letter") == "Dear Charles", "the draft has not outlived a restart");
  isRight &= check(storage.thumbnail("https://a.example/engine.jpg").has_value(), "the thumbnail is not there");
  isRight &= check(std::filesystem::exists(storage.webFolder() + "/page.html"), "the page is not there");
  storage.logOut();
  storage.logIn("charles");
  isRight &= check(!storage.draft("letter"), "somebody else sees the draft");
  isRight &= check(storage.thumbnail("https://a.example/engine.jpg").has_value(), "the thumbnail is not everybody's");
  storage.logOut();
  storage.logIn("ada");
  return isRight & check(!storage.draft("letter"), "the draft is still there after its owner has logged out");
}

template <class Storage> int runApplication(int argc, char** argv) {
  if (argc != 2) return 2;
  const bool isRight = useForADay<Storage>(argv[1]) && useOnTheNextDay<Storage>(argv[1]);
  std::cout << (isRight ? "Everything is where it should be.\n" : "");
  return isRight ? 0 : 1;
}
