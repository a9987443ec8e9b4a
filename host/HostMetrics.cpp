// How a host puts its metrics together.

#include <glog/logging.h>

#include <cerrno>
#include <exception>
#include <map>

#include "Clock.h"
#include "Configuration.h"
#include "FileUtils.h"
#include "LarderException.h"
#include "host/Host.h"
#include "host/ThreadQueueFactory.h"
#include "host/figures/ManagerFigures.h"
#include "host/sessions/BytesBelow.h"
#include "host/sessions/ManagerScopes.h"

namespace velmora::mobile::xplat::cellar::host {

namespace {

ManagerMetrics read(const StoreManagerDefinition& definition, const ScopeFigures& scope) {
  const auto found = scope.find(definition.name);
  return found == scope.end() ? limitsOf(definition) : found->second->read();
}

// A pass may take away at any moment what is looked at.
std::optional<TrashMetrics> measureTrash(FileUtils& fileUtils, const std::string& path) {
  TrashMetrics trash;
  try {
    if (fileUtils.isSymLink(path)) return std::nullopt;  // nothing is collected through a link
    trash.entries = fileUtils.listDirectory(path).size() + fileUtils.listOtherEntries(path).size();
  } catch (const FileUtilsIoException& error) {
    if (error.code() == ENOENT) return TrashMetrics{0, 0};
    LOG(ERROR) << "Cannot measure trash. " << error.what();
    return std::nullopt;
  } catch (const std::exception& error) {
    LOG(ERROR) << "Cannot measure trash. " << error.what();
    return std::nullopt;
  }
  try {
    trash.bytes = bytesBelow(fileUtils, path);
  } catch (const std::exception& error) {
    LOG(ERROR) << "Cannot measure trash. " << error.what();
  }
  return trash;
}

}  // namespace

HostMetrics Host::metrics(TrashSize trash) const {
  HostMetrics metrics;
  metrics.time = Clock::now();
  metrics.managers = managerMetrics();
  if (threads_ != nullptr) {
    const ThreadQueueFactory::Load load = threads_->load();
    metrics.queues = QueueMetrics{load.waiting, load.running};
  }
  if (trash == TrashSize::Measured) metrics.trash = measureTrash(*fileUtils_, trashPath_);
  return metrics;
}

std::vector<ManagerMetrics> Host::managerMetrics() const {
  const ScopeFigures sessionless = scopes_->figuresWithoutSession();
  const std::map<std::string, ScopeFigures> sessions = scopes_->figuresOfSessions();
  std::vector<ManagerMetrics> managers;
  for (const std::string& name : managerNames_) {
    const auto definition = configuration_->getManager(name);
    if (!definition->sessionScoped || sessions.empty()) {
      managers.push_back(read(*definition, sessionless));
      continue;
    }
    for (const auto& [tag, session] : sessions) {
      managers.push_back(read(*definition, session));
      managers.back().session = tag;
    }
  }
  return managers;
}

}  // namespace velmora::mobile::xplat::cellar::host
