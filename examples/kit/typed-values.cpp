// Values of types of one's own in a store. usage: kit-typed-values DIRECTORY

// KIT: begin
#include <cellar/Cellar.h>
#include <cellar/host/Await.h>
#include <cellar/host/Host.h>
#include <cellar/host/TypedStore.h>

#include <optional>
#include <string>

using namespace velmora::mobile::xplat::cellar;  // NOLINT: an example may

struct Draft {
  std::string title;
  int revision = 0;
};
NLOHMANN_DEFINE_TYPE_NON_INTRUSIVE(Draft, title, revision)  // to_json and from_json

std::string continueWriting(host::Host& host) {
  const host::TypedStore<Draft> drafts(host.store<PersistentKeyValueStore>("drafts"));
  drafts.put("https://a.example/?id=1", {"Novel", 7});  // any bytes are a key
  const std::optional<Draft> draft = host::await(drafts.get("https://a.example/?id=1"));
  return draft ? draft->title : "nothing to continue";
}

std::string whyUnreadable(host::Host& host) {
  const auto store = host.store<PersistentKeyValueStore>("drafts");
  host::TypedStore<std::string>(store).put("letter", "not JSON");
  try {
    static_cast<void>(host::await(host::TypedStore<Draft>(store).get("letter")));
  } catch (const host::DecodeError& error) {
    return error.what();  // names store and key, and says what the codec says
  }
  return "";
}
// KIT: end

#include <cstdlib>
#include <iostream>

int main(int argc, char** argv) {
  if (argc != 2) return EXIT_FAILURE;
  host::Host host(R"({"work": {"area": "documents", "stores": {"drafts": {"type": "pkvs", "has_version": true}}}})",
                  argv[1]);
  const std::string title = continueWriting(host);
  const std::string reason = whyUnreadable(host);
  std::cout << title << '\n' << reason << '\n';
  const std::string beginning = "The value of 'letter' in store 'drafts_v1' cannot be decoded: ";
  return title == "Novel" && reason.rfind(beginning, 0) == 0 ? EXIT_SUCCESS : EXIT_FAILURE;
}
