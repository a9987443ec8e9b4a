#include "demo/Application.h"

#include <glog/logging.h>

#include <chrono>
#include <fstream>
#include <mutex>
#include <utility>

#include "StoreManager.h"
#include "host/JsonLinesAnalytics.h"
#include "host/ThreadQueueFactory.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr std::chrono::minutes kPatience(1);
constexpr long kNoLazyWork = 86400;  // seconds: the demonstration asks for every store itself

}  // namespace

// Takes the log of the process in the place of the terminal. Any thread.
class Application::Log : private google::LogSink {
 public:
  explicit Log(const std::string& file) : file_(file) { google::AddLogSink(this); }
  ~Log() override { google::RemoveLogSink(this); }
  Log(const Log&) = delete;
  Log& operator=(const Log&) = delete;

  std::vector<std::string> takeErrors() {
    const std::lock_guard<std::mutex> lock(mutex_);
    return std::exchange(errors_, {});
  }

 private:
  using google::LogSink::send;
  void send(google::LogSeverity severity, const char* /*path*/, const char* file, int line,
            const google::LogMessageTime& /*time*/, const char* message, std::size_t length) override {
    const std::lock_guard<std::mutex> lock(mutex_);
    const std::string text(message, length);
    file_ << google::LogSeverityNames[severity] << ' ' << file << ':' << line << ' ' << text << std::endl;
    if (severity >= google::GLOG_ERROR) errors_.push_back(text);
  }

  std::mutex mutex_;  // guards the two below
  std::vector<std::string> errors_;
  std::ofstream file_;
};

Application::Application(const std::string& root)
    : root_(root), events_(root + "/analytics.jsonl"), log_(std::make_unique<Log>(root + "/log.txt")) {}

Application::~Application() = default;

void Application::launch(const std::string& release, const std::string& user) {
  stop();
  release_ = release;
  user_ = user;
  host::HostOptions options;
  options.configuration = kMediaAppConfiguration;
  options.root = root_;
  options.versionTag = release;
  options.localeFirstTag = "en";
  options.localeSecondTag = "US";
  options.lazyDelaySeconds = kNoLazyWork;
  options.analytics = std::make_unique<host::JsonLinesAnalytics>(events_);
  host_ = std::make_unique<host::Host>(std::move(options));
  stores_.clear();
  const JsonValue document = JsonValue::parse(kMediaAppConfiguration);
  for (const auto& [name, manager] : document.items()) {
    for (const auto& [identifier, ignored] : manager.at("stores").items()) {
      stores_.push_back(host_->configuration()->getStore(identifier));
    }
  }
}

void Application::openStores() {
  for (const auto& store : stores_) host_->store<Store>(store->name, user_);
}

void Application::stop() {
  if (host_ != nullptr) settle();
  host_.reset();
}

const StoreDefinition& Application::definition(const std::string& store) const {
  return *host_->configuration()->getStore(store);
}

bool Application::belongsToSession(const StoreDefinition& store) const {
  return host_->configuration()->getManager(store.managerName)->sessionScoped;
}

std::string Application::pathOf(const std::string& store) { return host_->store<Store>(store, user_)->path; }

std::shared_ptr<PersistentKeyValueStore> Application::values(const std::string& store) {
  return host_->store<PersistentKeyValueStore>(store, user_);
}

bool Application::settle() {
  const auto threads = std::dynamic_pointer_cast<host::ThreadQueueFactory>(host_->queues());
  return threads->drain(kPatience);
}

std::vector<JsonValue> Application::events() const {
  std::vector<JsonValue> events;
  std::ifstream in(events_);
  for (std::string line; std::getline(in, line);) events.push_back(JsonValue::parse(line));
  return events;
}

std::vector<std::string> Application::takeErrors() { return log_->takeErrors(); }

}  // namespace velmora::mobile::xplat::cellar::tools
