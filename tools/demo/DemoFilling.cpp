#include "demo/DemoFilling.h"

#include <algorithm>
#include <string>
#include <utility>
#include <vector>

#include "Progress.h"
#include "demo/DemoContext.h"
#include "demo/FileWriter.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr const char* kCovers = "covers";
constexpr std::size_t kPictureBytes = 256U << 10U;

struct Job {
  std::string store;
  std::string directory;
  std::vector<SourceFiles::File> files;
};

// One of `parts` even slices of the source files. Never empty: where there are fewer files than parts, some are used
// twice.
std::vector<SourceFiles::File> slice(const SourceFiles& source, std::size_t part, std::size_t parts, std::size_t most) {
  const std::size_t count = source.files.size();
  const std::size_t begin = count * part / parts;
  const std::size_t end = std::max(begin + 1, count * (part + 1) / parts);
  std::vector<SourceFiles::File> files;
  for (std::size_t i = begin; i < end && files.size() < most; ++i) files.push_back(source.files[i % count]);
  return files;
}

std::vector<SourceFiles::File> modelsOfPictures(const SourceFiles& source, std::uint64_t bytes) {
  std::vector<SourceFiles::File> files;
  while (files.size() < bytes / kPictureBytes) files.push_back(source.files[files.size() % source.files.size()]);
  return files;
}

std::vector<Job> plan(DemoContext& context, const Filling& filling) {
  const auto stores = context.unmanagedStores();
  std::vector<Job> jobs;
  for (std::size_t i = 0; i < stores.size(); ++i) {
    const StoreDefinition& store = *stores[i];
    if (context.contents[store.name].files > 0) continue;
    auto files = store.name == kCovers ? modelsOfPictures(context.source, store.maxSize * filling.coversPercent / 100)
                                       : slice(context.source, i, stores.size(), filling.mostFiles);
    jobs.push_back({store.name, context.app().expectedDirectory(store), std::move(files)});
  }
  return jobs;
}

TreeSize perform(const Job& job, FileWriter& writer) {
  TreeSize written;
  for (std::size_t i = 0; i < job.files.size(); ++i) {
    written += job.store == kCovers
                   ? writer.render(job.files[i], kPictureBytes, job.directory + "/" + std::to_string(i) + ".img")
                   : writer.copy(job.files[i], job.directory);
  }
  return written;
}

}  // namespace

TreeSize fillEmptyStores(DemoContext& context, const Filling& filling) {
  const std::vector<Job> jobs = plan(context, filling);
  std::size_t files = 0;
  for (const Job& job : jobs) files += job.files.size();

  Progress progress(context.console, files);
  FileWriter writer(progress);
  TreeSize written;
  for (const Job& job : jobs) {
    context.contents[job.store] = perform(job, writer);
    written += context.contents[job.store];
  }
  return written;
}

}  // namespace velmora::mobile::xplat::cellar::tools
