// An application's storage with the host kit. usage: with-kit NEW-DIRECTORY
#include "application.h"

#include "configuration.h"

// KIT: begin
#include <cellar/Cellar.h>
#include <cellar/host/Await.h>
#include <cellar/host/Host.h>
#include <cellar/host/TypedStore.h>

using namespace velmora::mobile::xplat::cellar;  // NOLINT: an example may
using Bytes = std::vector<unsigned char>;

class Storage {
 public:
  explicit Storage(const std::string& directory) : host_(kConfiguration, directory) {}
  void logIn(const std::string& user) { drafts_.emplace(host_.store<PersistentKeyValueStore>("drafts", user)); }
  void logOut() { host_.logOut(); }
  void keepDraft(const std::string& name, const std::string& text) { host::await(drafts_->put(name, text)); }
  std::optional<std::string> draft(const std::string& name) { return host::await(drafts_->get(name)); }
  void keepThumbnail(const std::string& url, const Bytes& jpeg) { thumbnails_.put(url, jpeg); }
  std::optional<Bytes> thumbnail(const std::string& url) { return host::await(thumbnails_.get(url)); }
  std::string webFolder() { return host_.store<UnmanagedStore>("web")->path; }

 private:
  host::Host host_;
  host::TypedStore<Bytes> thumbnails_{host_.store<DiskCache>("thumbnails")};
  std::optional<host::TypedStore<std::string>> drafts_;
};
// KIT: end

int main(int argc, char** argv) { return runApplication<Storage>(argc, argv); }
