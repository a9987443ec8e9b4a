#include "verify/StoreCheck.h"

#include <filesystem>
#include <memory>
#include <optional>
#include <unordered_set>

#include "JsonValue.h"
#include "ManifestSnapshot.h"
#include "storage/Layout.h"
#include "storage/StoreFiles.h"
#include "storage/UntouchedFiles.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace fs = std::filesystem;

namespace {

// Links are followed, as a store does when it reads a value. The store's own files are not values.
std::optional<std::uint64_t> sizeOfValue(const std::string& directory, const std::string& below) {
  if (isManifestFile(below)) return std::nullopt;
  const fs::path path = fs::path(directory) / below;
  std::error_code error;
  if (!fs::is_regular_file(path, error)) return std::nullopt;
  const std::uintmax_t size = fs::file_size(path, error);
  return error ? std::nullopt : std::make_optional<std::uint64_t>(size);
}

class StoreCheck {
 public:
  StoreCheck(const std::string& directory, OnFile onFile) : directory_(directory), onFile_(std::move(onFile)) {}

  Findings check(const ManifestSnapshot& snapshot) {
    const auto damages = snapshot.integrityErrors();
    if (!damages.empty()) {
      Finding finding = make(Finding::Kind::DamagedManifest, ManifestSnapshot::manifestName);
      finding.detail = damages.front();
      findings_.push_back(finding);
      return std::move(findings_);
    }
    for (const auto& record : snapshot.records(nullptr)) {
      record.item.hasInlineData ? checkInline(record) : checkFile(record.item);
    }
    findStrays();
    return std::move(findings_);
  }

 private:
  Finding make(Finding::Kind kind, const std::string& name) const { return {kind, directory_, name}; }

  void add(Finding::Kind kind, const DiskCacheItem& item, std::optional<std::uint64_t> actual) {
    Finding finding = make(kind, item.key);
    finding.recorded = item.size;
    finding.actual = actual.value_or(0);
    finding.hasFile = actual.has_value();
    findings_.push_back(finding);
  }

  // An empty value is one that is there: what has no bytes but should have some has lost them.
  void checkInline(const ManifestSnapshot::Record& record) {
    const std::uint64_t actual = record.inlineSize.value_or(0);
    if (actual == record.item.size) return;
    if (actual == 0) {
      add(Finding::Kind::InlineValueMissing, record.item, std::nullopt);
    } else {
      add(Finding::Kind::SizeDiffers, record.item, actual);
    }
  }

  void checkFile(const DiskCacheItem& item) {
    using Kind = Finding::Kind;
    const std::string below = (fs::path(".") / fs::path(item.filename).relative_path()).lexically_normal().string();
    const auto actual = sizeOfValue(directory_, below);
    if (actual) valueFiles_.insert(below);
    const bool isProvisional = item.size == 0;
    if (!actual) return add(isProvisional ? Kind::InterruptedWrite : Kind::RecordWithoutFile, item, actual);
    // Sizes are recorded in 32 bits, and wrap.
    if (static_cast<std::uint32_t>(*actual) == item.size) return;
    add(isProvisional ? Kind::InterruptedWrite : Kind::SizeDiffers, item, actual);
  }

  void findStrays() {
    walkTree(directory_, [this](const std::string& below, const Entry& entry) {
      if (entry.type == Entry::Type::Directory) return;
      onFile_(entry.size);
      if (isManifestFile(below) || isAttributesFile(entry) || valueFiles_.count(below) > 0) return;
      Finding finding = make(Finding::Kind::FileWithoutRecord, below);
      finding.actual = entry.size;
      findings_.push_back(finding);
    });
  }

  const std::string directory_;
  const OnFile onFile_;
  Findings findings_;
  std::unordered_set<std::string> valueFiles_;  // below the directory
};

bool isJson(const std::string& path) {
  const auto bytes = UntouchedFiles().readFile(path);
  return JsonValue::accept(std::string(bytes.begin(), bytes.end()));
}

}  // namespace

Findings checkStore(const StorePlace& place, const std::string& temporaryDirectory, const OnFile& onFile) {
  if (!place.hasManifest) return {};
  const ManifestSnapshot snapshot(place.path, temporaryDirectory, std::make_shared<UntouchedFiles>());
  return StoreCheck(place.path, onFile).check(snapshot);
}

Findings checkAttributes(const std::string& directory) {
  Findings findings;
  walkTree(directory, [&](const std::string& below, const Entry& entry) {
    if (!isAttributesFile(entry) || isJson(directory + "/" + below)) return;
    findings.push_back({Finding::Kind::DamagedAttributes, directory, below});
  });
  return findings;
}

}  // namespace velmora::mobile::xplat::cellar::tools
