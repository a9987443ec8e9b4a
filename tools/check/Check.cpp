#include "check/Check.h"

#include <CLI/CLI.hpp>
#include <cstdint>
#include <iostream>
#include <memory>
#include <string>

#include "Console.h"
#include "FileUtils.h"
#include "InputError.h"
#include "Printable.h"
#include "check/CheckReport.h"
#include "check/ConfigurationDocument.h"
#include "check/Faults.h"
#include "check/ResolvedConfiguration.h"
#include "check/Warnings.h"
#include "storage/FileSystemSize.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr int kClean = 0;
constexpr int kWarnings = 1;
constexpr int kErrors = 2;

struct CheckOptions {
  std::string file;
  std::string versionTag;
  std::string locale;
  std::string session;
  std::string root;
  bool json = false;
};

// "en_US" and "en-US" have two parts, "en" has one.
NameTags tagsOf(const CheckOptions& options) {
  const std::size_t middle = options.locale.find_first_of("_-");
  NameTags tags;
  tags.versionTag = options.versionTag;
  tags.localeFirstTag = options.locale.substr(0, middle);
  tags.localeSecondTag = middle == std::string::npos ? "" : options.locale.substr(middle + 1);
  tags.sessionKey = options.session;
  for (const std::string& tag : {options.versionTag, options.locale}) {
    if (tag.find('/') != std::string::npos) throw InputError("'" + tag + "' cannot be part of a file name");
  }
  return tags;
}

Diagnostics warningsOfPlace(const std::string& root, FileUtils& fileUtils) {
  if (root.empty()) return {};
  const std::int64_t size = fileSystemSize(root, fileUtils);
  return isTooSmall(size) ? Diagnostics{{"small_file_system", "", root + ": " + tooSmallText(size)}} : Diagnostics();
}

CheckResult checkDocument(const CheckOptions& options) {
  const NameTags tags = tagsOf(options);
  const ConfigurationDocument document = readConfigurationDocument(options.file);
  CheckResult result;
  result.file = options.file;
  result.faults = findFaults(document);
  if (!result.faults.empty()) {
    result.warnings = findWarningsBeside(result.faults, document, tags);
    return result;
  }
  result.resolved = resolve(document, tags);
  result.warnings = findWarnings(document, result.resolved);
  return result;
}

CheckResult check(const CheckOptions& options) {
  FileUtils fileUtils;
  const Diagnostics ofPlace = warningsOfPlace(options.root, fileUtils);
  CheckResult result = checkDocument(options);
  result.warnings.insert(result.warnings.begin(), ofPlace.begin(), ofPlace.end());
  return result;
}

void printFaults(const CheckResult& result) {
  for (const Diagnostic& fault : result.faults) {
    const std::string place = fault.pointer.empty() ? "" : fault.pointer + ": ";
    std::cerr << "cellar: " << printable(result.file + ": " + place + fault.text) << std::endl;
  }
}

int runCheck(const CheckOptions& options) {
  const CheckResult result = check(options);
  printFaults(result);
  if (options.json) {
    std::cout << printable(checkAsJson(result), 2) << std::endl;
  } else {
    Console console = Console::standardOutput();
    result.faults.empty() ? printCheck(result, console) : printWarnings(result, console);
  }
  if (!result.faults.empty()) return kErrors;
  return result.warnings.empty() ? kClean : kWarnings;
}

}  // namespace

void addCheckCommand(CLI::App& app, int& status) {
  const auto options = std::make_shared<CheckOptions>();
  CLI::App* const check =
      app.add_subcommand("check", "Show how the library reads a configuration, and warn of probable mistakes");
  check->add_option("CONFIG", options->file, "The configuration, a JSON document")->required()->type_name("FILE");
  check->add_option("--version-tag", options->versionTag, "The host's version tag, for the names of directories")
      ->type_name("TAG");
  check
      ->add_option("--locale", options->locale,
                   "The host's locale, for example \"en_US\", for the names of directories")
      ->type_name("LOCALE");
  check->add_option("--session", options->session, "The key of a session; directories are named as by the host kit")
      ->type_name("KEY");
  check
      ->add_option("--root", options->root,
                   "The directory that is to hold everything: warn if its file system is too small")
      ->type_name("DIR");
  check->add_flag("--json", options->json, "Print one JSON object for machines; sizes in bytes, durations in seconds");
  check->footer(
      "Reads the document with the library's own parser and prints the result: managers and stores with every\n"
      "default filled in, and their directories. Then one line for each thing that the library accepts but that\n"
      "is probably a mistake: misspelt and ignored keys, sizes that wrapped, caches without a limit, stores that\n"
      "share a directory, and more.\n\n"
      "Example:\n  cellar check storage.json --version-tag 250 --locale en_US --session alice\n\n"
      "Exit status: 0 without warnings, 1 with some, 2 when the library refuses the document.");
  check->callback([options, &status] { status = runCheck(*options); });
}

}  // namespace velmora::mobile::xplat::cellar::tools
