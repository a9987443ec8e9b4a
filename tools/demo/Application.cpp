#include "demo/Application.h"

#include <chrono>
#include <stdexcept>
#include <utility>

#include "StoreManager.h"
#include "host/JsonLinesAnalytics.h"
#include "host/ThreadQueueFactory.h"

namespace velmora::mobile::xplat::cellar::tools {

Application::Application(const std::string& root)
    : root_(root), events_(root + "/analytics.jsonl"), configuration_(kMediaAppConfiguration), log_(root + "/log.txt") {
  google::AddLogSink(this);
  const JsonValue document = JsonValue::parse(kMediaAppConfiguration);
  for (const auto& [name, manager] : document.items()) {
    for (const auto& [identifier, ignored] : manager.at("stores").items()) {
      stores_.push_back(configuration_.getStore(identifier));
      (stores_.back()->isManaged ? withKeys_ : unmanaged_).insert(identifier);
    }
  }
}

Application::~Application() {
  stop();
  google::RemoveLogSink(this);
}

void Application::launch(const std::string& release, const std::string& user) {
  release_ = release;
  user_ = user;
  host::HostOptions options;
  options.configuration = kMediaAppConfiguration;
  options.root = root_;
  options.versionTag = release;
  options.localeFirstTag = "en";
  options.localeSecondTag = "US";
  options.lazyDelaySeconds = 86400;  // never: the demonstration asks for every store itself
  options.analytics = std::make_unique<host::JsonLinesAnalytics>(events_);
  host_ = std::make_unique<host::Host>(std::move(options));
}

void Application::openStores() {
  for (const auto& store : stores_) host_->store<Store>(store->name, user_);
}

std::string Application::pathOf(const std::string& store) { return host_->store<Store>(store, user_)->path; }

std::shared_ptr<PersistentKeyValueStore> Application::values(const std::string& store) {
  return host_->store<PersistentKeyValueStore>(store, user_);
}

void Application::settle() {
  const auto threads = std::dynamic_pointer_cast<host::ThreadQueueFactory>(host_->queues());
  if (!threads->drain(std::chrono::minutes(1))) throw std::runtime_error("the work in the background does not end");
}

std::map<std::string, std::vector<JsonValue>> Application::events() const {
  std::map<std::string, std::vector<JsonValue>> payloads;
  std::ifstream in(events_);
  for (std::string line; std::getline(in, line);) {
    const JsonValue event = JsonValue::parse(line);
    payloads[event.at("event").get<std::string>()].push_back(event.at("payload"));
  }
  return payloads;
}

std::vector<std::string> Application::takeErrors() {
  const std::lock_guard<std::mutex> lock(mutex_);
  return std::exchange(errors_, {});
}

// Any thread.
void Application::send(google::LogSeverity severity, const char* /*path*/, const char* file, int line,
                       const google::LogMessageTime& /*time*/, const char* message, std::size_t length) {
  const std::lock_guard<std::mutex> lock(mutex_);
  const std::string text(message, length);
  log_ << google::LogSeverityNames[severity] << ' ' << file << ':' << line << ' ' << text << std::endl;
  if (severity >= google::GLOG_ERROR) errors_.push_back(text);
}

}  // namespace velmora::mobile::xplat::cellar::tools
