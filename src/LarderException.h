#pragma once

#include <stdexcept>
#include <string>

#include "Export.h"

namespace velmora::mobile::xplat::cellar {

// Root of every failure that the library reports by exception. Beside the description it carries an error domain (fixed
// by the subclass) and a code whose meaning depends on the domain. Thrown by value, caught by reference; accessors
// never throw and their pointers live as long as the exception.
class CELLAR_EXPORT LarderException : public std::runtime_error {
 public:
  LarderException(const std::string& description, const std::string& domain, int code);
  ~LarderException() override;

  // "domain: D; code: C; description: TEXT ." (the blank before the full stop belongs to the format).
  const char* what() const noexcept override;
  virtual const char* domain() const noexcept;
  virtual int code() const noexcept;
  virtual const char* description() const noexcept;

 private:
  std::string domain_;
  int code_;
  std::string description_;
  std::string message_;
};

// A configuration that contradicts itself, or a manager or store that it does not name. Code 0.
class CELLAR_EXPORT ConfigurationException : public LarderException {
 public:
  explicit ConfigurationException(const std::string& message);
  ~ConfigurationException() override;
};

// A file operation that failed. The code is the `errno` of the failed call, or 0 for the library's own checks.
class CELLAR_EXPORT FileUtilsIoException : public LarderException {
 public:
  FileUtilsIoException(int code, const std::string& message);
  ~FileUtilsIoException() override;
};

// A manifest that was asked for something it cannot know yet. Built by the thrower with its domain and code 0.
class CELLAR_EXPORT DiskCacheManifestException : public LarderException {
 public:
  using LarderException::LarderException;
  ~DiskCacheManifestException() override;
};

// The manifest could not be read or written. The code is the database's own result code.
class CELLAR_EXPORT ManifestPersistenceException : public LarderException {
 public:
  ManifestPersistenceException(const std::string& message, int code);
  ~ManifestPersistenceException() override;
};

// The manifest on disk is damaged or foreign: its store starts again from nothing.
class CELLAR_EXPORT ManifestCorruptedException : public ManifestPersistenceException {
 public:
  ManifestCorruptedException(const std::string& message, int code);
  ~ManifestCorruptedException() override;
};

// An SQLite call failed. The code is SQLite's result code, or -1 where the library itself found the fault.
// Shares its domain with the corrupted subclass: tell the two apart by class.
class CELLAR_EXPORT SQLiteStoreException : public LarderException {
 public:
  SQLiteStoreException(const std::string& message, int code);
  ~SQLiteStoreException() override;
};

// The database file is damaged, foreign, or has another schema than expected.
class CELLAR_EXPORT SQLiteStoreCorruptedException : public SQLiteStoreException {
 public:
  SQLiteStoreCorruptedException(const std::string& message, int code);
  ~SQLiteStoreCorruptedException() override;
};

// A value whose bytes are not those that were stored. Code 0.
class CELLAR_EXPORT DamagedValueException : public LarderException {
 public:
  // "The value of '" + key + "' in store '" + store + "' is damaged."
  DamagedValueException(const std::string& store, const std::string& key);
  ~DamagedValueException() override;

  const std::string& store() const noexcept;
  const std::string& key() const noexcept;

 private:
  std::string store_;
  std::string key_;
};

// Work was asked of a store that has been invalidated. Code 0.
class CELLAR_EXPORT InvalidatedException : public LarderException {
 public:
  explicit InvalidatedException(const std::string& message);
  ~InvalidatedException() override;
};

}  // namespace velmora::mobile::xplat::cellar
