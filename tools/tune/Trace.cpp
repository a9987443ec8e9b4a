#include "tune/Trace.h"

#include <algorithm>
#include <cerrno>
#include <limits>
#include <system_error>

#include "InputError.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

// So that no sum of sizes exceeds 64 bits.
constexpr std::int64_t kMostBytes = std::int64_t{1} << 60;

[[noreturn]] void fail(const char* what, int code) {
  throw InputError(std::string(what) + ": " + std::generic_category().message(code));
}

}  // namespace

Trace::Trace() : file_(std::tmpfile()) {
  if (file_ == nullptr) fail("cannot create a temporary file for the accesses", errno);
}

Trace::~Trace() = default;

void Trace::append(const std::string& key, Access access) {
  access.key = numberOf(key);
  if (access.size != Access::kUnknownSize) {
    if (access.size > kMostBytes - bytes_) throw InputError("the sizes add up to more than can be counted");
    bytes_ += access.size;
    if (firstSizes_[access.key] == Access::kUnknownSize) firstSizes_[access.key] = access.size;
  }
  if (accesses_ == 0) firstDate_ = access.date;
  lastDate_ = access.date;
  hasMetadata_ = hasMetadata_ || access.itemType != Access::kNoMetadata;
  if (std::fwrite(&access, sizeof access, 1, file_.get()) != 1) fail("cannot keep the accesses", errno);
  ++accesses_;
}

void Trace::mayBeEmpty(const std::string& key) { mayBeEmpty_[numberOf(key)] = true; }

void Trace::replay(const std::function<void(const Access&)>& visit) const {
  std::vector<std::int64_t> sizes = startingSizes();
  if (std::fseek(file_.get(), 0, SEEK_SET) != 0) fail("cannot read the accesses again", errno);
  Access access;
  for (std::uint64_t i = 0; i < accesses_; ++i) {
    if (std::fread(&access, sizeof access, 1, file_.get()) != 1) fail("cannot read the accesses again", errno);
    if (access.size == Access::kUnknownSize) access.size = sizes[access.key];
    sizes[access.key] = access.size;
    visit(access);
  }
}

std::uint64_t Trace::keysOfUnknownSize() const {
  std::uint64_t count = 0;
  for (std::size_t key = 0; key < firstSizes_.size(); ++key) {
    if (firstSizes_[key] == Access::kUnknownSize && !mayBeEmpty_[key]) ++count;
  }
  return count;
}

std::int64_t Trace::assumedSize() const {
  if (assumedSize_ != Access::kUnknownSize) return assumedSize_;
  std::int64_t sum = 0;
  std::int64_t count = 0;
  for (const std::int64_t size : firstSizes_) {
    if (size == Access::kUnknownSize) continue;
    sum += size;
    ++count;
  }
  return count == 0 ? 0 : sum / count;
}

std::int64_t Trace::seconds() const { return std::max<std::int64_t>(0, lastDate_ - firstDate_); }

std::uint32_t Trace::numberOf(const std::string& key) {
  const auto [found, isNew] = numbers_.emplace(key, static_cast<std::uint32_t>(firstSizes_.size()));
  if (isNew) {
    constexpr std::size_t mostKeys = std::numeric_limits<std::uint32_t>::max() / 4;
    if (firstSizes_.size() >= mostKeys) throw InputError("there are too many keys");
    firstSizes_.push_back(Access::kUnknownSize);
    mayBeEmpty_.push_back(false);
  }
  return found->second;
}

std::vector<std::int64_t> Trace::startingSizes() const {
  std::vector<std::int64_t> sizes = firstSizes_;
  const std::int64_t assumed = assumedSize();
  for (std::size_t key = 0; key < sizes.size(); ++key) {
    if (sizes[key] == Access::kUnknownSize) sizes[key] = mayBeEmpty_[key] ? 0 : assumed;
  }
  return sizes;
}

void Trace::CloseFile::operator()(std::FILE* file) const { (void)std::fclose(file); }

}  // namespace velmora::mobile::xplat::cellar::tools
