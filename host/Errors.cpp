#include "host/Errors.h"

#include <cellar/LarderException.h>

#include "host/errors/Texts.h"

namespace velmora::mobile::xplat::cellar::host {

StoreError::StoreError(std::string store, std::string key, std::string path)
    : std::runtime_error(joined({culprit(store, key, path), currentText()})),
      store_(std::move(store)),
      key_(std::move(key)),
      path_(std::move(path)) {}

StoreError::StoreError(const std::string& text, std::string store, std::string key, std::string path)
    : std::runtime_error(text), store_(std::move(store)), key_(std::move(key)), path_(std::move(path)) {}

StoreError::~StoreError() = default;

const std::string& StoreError::store() const noexcept { return store_; }
const std::string& StoreError::key() const noexcept { return key_; }
const std::string& StoreError::path() const noexcept { return path_; }

ConfigurationError::ConfigurationError(const std::string& reason, std::string pointer, std::size_t line,
                                       std::size_t column)
    : pointer_(std::move(pointer)),
      line_(line),
      column_(column),
      text_(joined({"Configuration", pointer_.empty() ? "" : ", ", pointer_, ", line ", std::to_string(line_),
                    ", column ", std::to_string(column_), ": ", reason})) {}

ConfigurationError::~ConfigurationError() = default;

const std::string& ConfigurationError::text() const noexcept { return text_; }
const std::string& ConfigurationError::pointer() const noexcept { return pointer_; }
std::size_t ConfigurationError::line() const noexcept { return line_; }
std::size_t ConfigurationError::column() const noexcept { return column_; }

namespace detail {

void throwNamed(const std::string& path, const std::string& key) {
  try {
    throw;
  } catch (const StoreError&) {
    throw;
  } catch (const std::future_error&) {
    throw;
  } catch (const InvalidatedException& error) {
    if (dynamic_cast<const std::nested_exception*>(&error) != nullptr) throw;  // has been here
    std::throw_with_nested(InvalidatedException(culprit(nameOfDirectory(path), key, path) + error.description()));
  } catch (...) {
    throw StoreError(nameOfDirectory(path), key, path);
  }
}

std::exception_ptr named(const std::exception_ptr& failure, const std::string& path, const std::string& key) {
  try {
    try {
      std::rethrow_exception(failure);
    } catch (...) {
      throwNamed(path, key);
    }
  } catch (...) {
    return std::current_exception();
  }
}

}  // namespace detail

}  // namespace velmora::mobile::xplat::cellar::host
