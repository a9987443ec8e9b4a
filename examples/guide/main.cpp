// The application that docs/guide.md builds, step by step. usage: photos STORAGE.json DATA-DIRECTORY

// GUIDE open: begin
#include <cellar/Cellar.h>
#include <cellar/host/Await.h>
#include <cellar/host/FileNames.h>
#include <cellar/host/Host.h>
#include <cellar/host/JsonLinesAnalytics.h>

#include <exception>
#include <fstream>
#include <functional>
#include <future>
#include <iostream>
#include <iterator>
#include <memory>
#include <string>
#include <utility>
#include <vector>

namespace cellar = velmora::mobile::xplat::cellar;
using Bytes = std::vector<unsigned char>;

std::string textOf(const std::string& path) {
  std::ifstream file(path);
  return {std::istreambuf_iterator<char>(file), {}};
}

std::unique_ptr<cellar::host::Host> openHost(const std::string& configuration, const std::string& data) {
  cellar::FileUtils().createDirectory(data, true);
  cellar::host::HostOptions options;
  options.configuration = textOf(configuration);
  options.root = data + "/storage";
  options.versionTag = "1";  // a release with another tag starts with empty stores
  options.analytics = std::make_unique<cellar::host::JsonLinesAnalytics>(data + "/analytics.jsonl");
  options.onIncident = [](const cellar::Incident& incident) {
    std::cerr << "storage: " << incident.name << ": " << incident.description << '\n';  // called on a queue of its own
  };
  return std::make_unique<cellar::host::Host>(std::move(options));
}
// GUIDE open: end

// GUIDE cache: begin
Bytes download(const std::string& url) { return {url.begin(), url.end()}; }  // stands for the network

// The picture's thumbnail, from the cache if it is there.
Bytes thumbnail(cellar::host::Host& host, const std::string& url) {
  const auto thumbs = host.store<cellar::DiskCache>("thumbs", "alice");
  const std::string key = cellar::host::encodeFileName(url);  // keys are file names: encode what is not yours
  if (const auto found = cellar::host::await(thumbs->fetch(key))) return found->value;
  Bytes bytes = download(url);
  cellar::host::await(thumbs->store(key, bytes));
  return bytes;
}
// GUIDE cache: end

// GUIDE later: begin
// Without waiting: the callback is called when the draft is there, on the queue that has read it.
void showDraft(cellar::host::Host& host, const std::string& name, const std::function<void(const std::string&)>& show) {
  using Found = std::unique_ptr<cellar::PersistentKeyValueStore::FetchResult>;
  const auto drafts = host.store<cellar::PersistentKeyValueStore>("drafts", "alice");
  drafts->fetch(name).then(nullptr, [show](std::future<Found>& result) {
    try {
      const Found found = result.get();
      show(found == nullptr ? "no draft" : std::string(found->value.begin(), found->value.end()));
    } catch (const std::exception& error) {
      show(error.what());  // a disk that cannot be read, or a draft that is damaged
    }
  });
}
// GUIDE later: end

// GUIDE directory: begin
void exportAlbum(cellar::host::Host& host, const std::string& name) {
  const auto exports = host.store<cellar::UnmanagedStore>("exports", "alice");
  std::ofstream(exports->path + "/" + name) << "an album";  // a plain directory, yours to fill
}
// GUIDE directory: end

// GUIDE main: begin
int main(int argc, char** argv) {
  if (argc != 3) return 2;
  try {
    const auto host = openHost(argv[1], argv[2]);
    for (int visit = 1; visit <= 3; ++visit) thumbnail(*host, "https://example.org/sunrise.jpg");

    const auto drafts = host->store<cellar::PersistentKeyValueStore>("drafts", "alice");
    cellar::host::await(drafts->store("letter", {'h', 'e', 'l', 'l', 'o'}));
    std::promise<std::string> shown;
    showDraft(*host, "letter", [&shown](const std::string& text) { shown.set_value(text); });
    std::cout << "draft: " << shown.get_future().get() << '\n';

    exportAlbum(*host, "summer.zip");
    host->logOut();  // alice's thumbs, drafts and exports are removed
    const auto bobs = host->store<cellar::PersistentKeyValueStore>("drafts", "bob");
    std::cout << "bob has a letter: " << (cellar::host::await(bobs->fetch("letter")) != nullptr ? "yes" : "no") << '\n';
    for (const auto& session : host->sessions()) std::cout << "data of: " << session.key.value_or("?") << '\n';
    return 0;
  } catch (const std::exception& error) {
    std::cerr << "photos: " << error.what() << '\n';
    return 1;
  }
}
// GUIDE main: end
