#pragma once

#include <cstddef>
#include <exception>
#include <future>
#include <stdexcept>
#include <string>
#include <utility>

#include <cellar/Export.h>
#include <cellar/Future.h>
#include <cellar/Store.h>
#include <cellar/host/Futures.h>

// Errors that name the culprit. docs/errors.md lists all errors of the library and of the kit.
namespace velmora::mobile::xplat::cellar::host {

// An operation of a store has failed. What the library, a codec or a callback has thrown is nested
// (`std::rethrow_if_nested`), and its text is a part of this one.
class CELLAR_EXPORT StoreError : public std::runtime_error, public std::nested_exception {
 public:
  // To be made while the nested exception is handled. "Store 'drafts__v1', key 'x', /data/drafts__v1: TEXT"; without
  // the key if it is empty, with a long one shortened.
  StoreError(std::string store, std::string key, std::string path);
  ~StoreError() override;

  // The name of the store's directory. Where a `Host` has thrown this its identifier, or "" if a manager could not be
  // built.
  const std::string& store() const noexcept;
  const std::string& key() const noexcept;   // as the operation was given it; empty if it was not about one key
  const std::string& path() const noexcept;  // the directory

 protected:
  // With a text of its own.
  StoreError(const std::string& text, std::string store, std::string key, std::string path);

 private:
  std::string store_;
  std::string key_;
  std::string path_;
};

// What the errors about a configuration have in common. It is thrown together with the library's own exception, as one
// object that can be caught as either: as this class, or as `std::invalid_argument`, `ConfigurationException` or the
// JSON library's `parse_error`, `type_error` or `out_of_range`, whose code, id and description are the original's. The
// original is nested, and its text is a part of `text`, which is also what `what` of that other class returns.
class CELLAR_EXPORT ConfigurationError : public std::nested_exception {
 public:
  ~ConfigurationError() override;

  // "Configuration, /media/stores/thumbs/max_size, line 5, column 21: TEXT"; without the pointer if it is empty.
  const std::string& text() const noexcept;

  // The JSON pointer of the value that is at fault; of a name that is used twice, the second. Empty for the document
  // itself, and for a text that is not JSON.
  const std::string& pointer() const noexcept;

  // Where that value begins, or the name that is used twice, or where the text stops to be JSON. From 1, in bytes.
  std::size_t line() const noexcept;
  std::size_t column() const noexcept;

 protected:
  // To be made while the nested exception is handled.
  ConfigurationError(const std::string& reason, std::string pointer, std::size_t line, std::size_t column);

 private:
  std::string pointer_;
  std::size_t line_;
  std::size_t column_;
  std::string text_;
};

namespace detail {

// Throws the exception that is being handled so that it names the culprit. See `naming`.
[[noreturn]] CELLAR_EXPORT void throwNamed(const std::string& path, const std::string& key);

// The same of an exception that is not null, returned.
[[nodiscard]] CELLAR_EXPORT std::exception_ptr named(const std::exception_ptr& failure, const std::string& path,
                                                     const std::string& key);

}  // namespace detail

// The future with the same value, whose failure names the store and the key. The pieces of the kit do this themselves;
// it is for the futures of a store that you use directly:
//
//   naming(store->fetch("x"), *store, "x")
//
// A failure becomes a `StoreError`, with three exceptions. `InvalidatedException`, which says that a session or the
// store has been ended, stays one: its text names the culprit, and the library's own is nested in it. A
// `std::future_error` (broken promise: the work was dropped) and what is a `StoreError` already are passed on as they
// are.
//
// Takes the value of `source` and throws as `then` does. The store does not have to outlive the call. Any thread.
template <class T> [[nodiscard]] Future<T> naming(Future<T> source, const Store& store, std::string key = "") {
  return then(std::move(source), [path = store.path, key = std::move(key)](std::future<T>& result) {
    try {
      return result.get();
    } catch (...) {
      detail::throwNamed(path, key);
    }
  });
}

}  // namespace velmora::mobile::xplat::cellar::host
