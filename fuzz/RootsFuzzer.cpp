// `cellar inspect` and `cellar verify` on any storage root: they show it or refuse it, and change nothing. `--repair`
// changes nothing outside, removes no file that a sound record names, and what it has repaired is found no more.
//
// The first byte of the input chooses the directory and whether there is a configuration; `buildRoot` reads the others.

#include <stdlib.h>  // NOLINT(modernize-deprecated-headers): setenv is not in the other one

#include <algorithm>
#include <cstdint>
#include <filesystem>
#include <map>
#include <nlohmann/json.hpp>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "harness/ByteReader.h"
#include "harness/Check.h"
#include "harness/Command.h"
#include "harness/Fuzzing.h"
#include "harness/ManifestFile.h"
#include "harness/RootDirectory.h"
#include "harness/Scratch.h"
#include "harness/Tree.h"
#include "page/Page.h"

namespace velmora::mobile::xplat::cellar::fuzz {
namespace {

namespace fs = std::filesystem;
using Json = nlohmann::json;

const std::string kManifest = "manifest_v1.sqlite";
const char* const kConfiguration = R"({
  "m": {"area": "caches", "max_size": "1KB", "stores": {
    "s": {"type": "disk_cache", "has_version": true, "version": 1, "lru_size_limit": "1B", "prune_strategy": "greedy_dual"},
    "t": {"type": "pkvs", "locale_sensitive": true, "has_version": true, "version": 2, "durability": "safe"}}},
  "n": {"area": "documents", "session_scoped": true, "stores": {"u": {"type": "unmanaged", "has_version": true}}}})";

bool isCompanion(const std::string& path) { return path.find("/" + kManifest + "-") != std::string::npos; }

class Root {
 public:
  Root(const Scratch& scratch, ByteReader& input)
      : scratch_(scratch), choice_(input.byte()), root_(buildRoot(scratch, input)) {
    (void)setenv("TMPDIR", scratch.makeDirectory("temporary").c_str(), 1);
    makeOld(scratch.path());
  }

  void checkLooking() {
    const Tree before = treeOf(scratch_.path());
    closeDoors();
    const Outcome inspection = checkBothForms("inspect", {"--html=" + scratch_.file("page")});
    (void)checkBothForms("verify", {});
    makeReadable(scratch_.path());
    check(fs::exists(scratch_.file("page")) != inspection.output.empty(), "a page is written with what is shown");
    if (!inspection.output.empty()) checkPage(scratch_.read("page"), tools::kInspectPage);
    const Tree now = treeOf(scratch_.path());
    check(fs::is_empty(scratch_.file("temporary")), "nothing temporary is left");
    checkUnchanged(before, now, "/place", "looking changes nothing");
    checkUnchanged(before, now, "/outside", "looking changes nothing outside");
  }

  void checkRepair() {
    const Tree before = treeOf(scratch_.path());
    const std::set<FileNumber> named = filesOfSoundRecords(scratch_, before);
    closeDoors();
    const Outcome repair = run({"verify", "--repair", "--json"});
    const Outcome again = run({"verify", "--json"});
    makeReadable(scratch_.path());
    const Tree now = treeOf(scratch_.path());
    checkUnchanged(before, now, "/outside", "repairing changes nothing outside");
    if (repair.output.empty()) return checkUnchanged(before, now, "/place", "what is refused is not repaired");
    checkJson(repair.output);
    const Json findings = Json::parse(repair.output).at("findings");
    checkNothingIsLost(before, now, named, findings);
    if (!again.output.empty()) checkRepaired(findings, Json::parse(again.output).at("findings"));
  }

 private:
  Outcome run(std::vector<std::string> arguments) const {
    static const std::vector<std::string> directories = {"", "", "/caches", "/caches/_sessionlessStore",
                                                         "/caches/_sessionlessStore/s_v1"};
    arguments.push_back(root_.path + directories[choice_ % directories.size()]);
    if (choice_ >= 128) arguments.push_back("--config=" + scratch_.path() + "/storage.json");
    Outcome outcome = runCommand(arguments);
    const bool isShown = outcome.output.find(kKeyOutside) != std::string::npos;
    check(!isShown || root_.hasHardLinks, "a manifest outside is not read", outcome.output);
    return outcome;
  }

  void closeDoors() const {
    for (const std::string& path : root_.unreadable) {
      std::error_code ignored;
      fs::permissions(path, fs::perms::none, ignored);
    }
  }

  // The outcome for machines.
  Outcome checkBothForms(const char* command, std::vector<std::string> options) const {
    const Outcome text = run({command});
    checkText(text.output);
    options.insert(options.begin(), {command, "--json"});
    Outcome json = run(options);
    check(text.status == json.status && text.reason == json.reason, "the form decides on nothing else", json.reason);
    check(text.output.empty() == json.output.empty(), "what is shown is shown in both forms", text.output);
    if (!json.output.empty()) checkJson(json.output);
    return json;
  }

  // Only these are ever removed: what a safe store removes itself, and what SQLite does.
  static void checkNothingIsLost(const Tree& before, const Tree& now, const std::set<FileNumber>& named,
                                 const Json& findings) {
    std::set<std::string> removed;
    for (const Json& finding : findings) {
      const std::string kind = finding.at("kind");
      const bool isRemoved = kind == "superseded_file" || kind == "unfinished_file" || kind == "unfinished_manifest";
      if (isRemoved) removed.insert(finding.at("name"));
    }
    std::map<FileNumber, std::string> contents;
    for (const auto& [path, entry] : now) contents[entry.number] = entry.content;
    for (const auto& [path, entry] : before) {
      if (!entry.isFile) continue;
      const auto found = contents.find(entry.number);
      const bool isThere = found != contents.end();
      if (named.count(entry.number) > 0) {
        check(isThere && found->second == entry.content, "a file that a sound record names stays", path);
      }
      const bool mayGo = isCompanion(path) || removed.count(fs::path(path).filename()) > 0;
      check(isThere || mayGo, "a file is only removed where that is said", path);
    }
  }

  static void checkRepaired(const Json& findings, const Json& later) {
    for (const Json& finding : findings) {
      if (!finding.at("repaired").get<bool>()) continue;
      const bool isThere = std::any_of(later.begin(), later.end(), [&](const Json& other) {
        return other.at("kind") == finding.at("kind") && other.at("path") == finding.at("path") &&
               other.at("name") == finding.at("name");
      });
      check(!isThere, "what is repaired is found no more", finding.dump());
    }
  }

  const Scratch& scratch_;
  const std::uint8_t choice_;
  const RootDirectory root_;
};

void run(ByteReader input) {
  const Scratch scratch;
  (void)scratch.write("storage.json", kConfiguration);
  Root root(scratch, input);
  root.checkLooking();
  root.checkRepair();
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::fuzz

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  namespace fuzz = velmora::mobile::xplat::cellar::fuzz;
  fuzz::obeyPermissions();
  fuzz::run({data, size});
  return 0;
}
