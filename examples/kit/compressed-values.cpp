// A codec with a state that compresses what another codec writes. usage: kit-compressed-values DIRECTORY

// KIT: begin
#include <zlib.h>

#include <cellar/Cellar.h>
#include <cellar/host/Await.h>
#include <cellar/host/Host.h>
#include <cellar/host/TypedStore.h>

#include <cstddef>
#include <optional>
#include <stdexcept>
#include <string>
#include <vector>

using namespace velmora::mobile::xplat::cellar;  // NOLINT: an example may
using Bytes = std::vector<unsigned char>;

class CompressingCodec {
 public:
  explicit CompressingCodec(int level) : level_(level) {}

  Bytes encode(const std::string& text) const {
    const auto* const begin = reinterpret_cast<const Bytef*>(text.data());
    uLongf size = compressBound(text.size());
    Bytes bytes(size);
    if (compress2(bytes.data(), &size, begin, text.size(), level_) != Z_OK) throw std::runtime_error("Not compressed.");
    bytes.resize(size);
    return bytes;
  }

  std::string decode(const Bytes& bytes) const {
    std::string text(kLargest, '\0');
    uLongf size = text.size();
    auto* const begin = reinterpret_cast<Bytef*>(text.data());
    if (uncompress(begin, &size, bytes.data(), bytes.size()) != Z_OK) throw std::runtime_error("Not decompressed.");
    text.resize(size);
    return text;
  }

 private:
  static constexpr std::size_t kLargest = 1'000'000;  // bytes of a text

  int level_;
};

// Compressed on this thread, decompressed on a queue of its own: other operations of the store need not wait for it.
std::optional<std::string> keepAPage(host::Host& host, const std::string& page) {
  const auto store = host.store<DiskCache>("pages");
  const host::TypedStore<std::string, CompressingCodec> pages(store, CompressingCodec(9), host.queues()->createQueue());
  pages.put("a.example", page);
  return host::await(pages.get("a.example"));
}
// KIT: end

#include <cstdlib>
#include <iostream>

int main(int argc, char** argv) {
  if (argc != 2) return EXIT_FAILURE;
  host::Host host(R"({"web": {"area": "caches", "stores": {"pages": {"type": "disk_cache", "has_version": true}}}})",
                  argv[1]);
  const std::string page(100'000, 'a');
  const bool isThere = keepAPage(host, page) == page;
  const auto stored = host::await(host.store<DiskCache>("pages")->fetch("a.example"));
  const std::size_t bytes = stored == nullptr ? 0 : stored->value.size();
  std::cout << page.size() << " bytes in " << bytes << '\n';
  return isThere && bytes > 0 && bytes < 1000 ? EXIT_SUCCESS : EXIT_FAILURE;
}
