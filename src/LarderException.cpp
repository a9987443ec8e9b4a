#include "LarderException.h"

namespace velmora::mobile::xplat::cellar {

LarderException::LarderException(const std::string& description, const std::string& domain, int code)
    : std::runtime_error(description),
      domain_(domain),
      code_(code),
      description_(description),
      message_("domain: " + domain + "; code: " + std::to_string(code) + "; description: " + description + " .") {}

const char* LarderException::what() const noexcept { return message_.c_str(); }
const char* LarderException::domain() const noexcept { return domain_.c_str(); }
int LarderException::code() const noexcept { return code_; }
const char* LarderException::description() const noexcept { return description_.c_str(); }

ConfigurationException::ConfigurationException(const std::string& message)
    : LarderException(message, "QZConfigurationErrorDomain", 0) {}

FileUtilsIoException::FileUtilsIoException(int code, const std::string& message)
    : LarderException(message, "QZLarderIoErrorErrorDomain", code) {}

ManifestPersistenceException::ManifestPersistenceException(const std::string& message, int code)
    : LarderException(message, "QZManifestPersistenceErrorDomain", code) {}

ManifestCorruptedException::ManifestCorruptedException(const std::string& message, int code)
    : ManifestPersistenceException(message, code) {}

SQLiteStoreException::SQLiteStoreException(const std::string& message, int code)
    : LarderException(message, "QZSQLiteStoreCorruptedErrorDomain", code) {}

SQLiteStoreCorruptedException::SQLiteStoreCorruptedException(const std::string& message, int code)
    : SQLiteStoreException(message, code) {}

DamagedValueException::DamagedValueException(const std::string& store, const std::string& key)
    : LarderException("The value of '" + key + "' in store '" + store + "' is damaged.", "QZDamagedValueErrorDomain",
                      0),
      store_(store),
      key_(key) {}

const std::string& DamagedValueException::store() const noexcept { return store_; }
const std::string& DamagedValueException::key() const noexcept { return key_; }

InvalidatedException::InvalidatedException(const std::string& message)
    : LarderException(message, "QZInvalidatedExceptionErrorDomain", 0) {}

// Defined here, so that each class has its run-time type information in the library alone: an exception thrown inside
// it is then caught by class in every module of the application.
LarderException::~LarderException() = default;
ConfigurationException::~ConfigurationException() = default;
FileUtilsIoException::~FileUtilsIoException() = default;
DiskCacheManifestException::~DiskCacheManifestException() = default;
ManifestPersistenceException::~ManifestPersistenceException() = default;
ManifestCorruptedException::~ManifestCorruptedException() = default;
SQLiteStoreException::~SQLiteStoreException() = default;
SQLiteStoreCorruptedException::~SQLiteStoreCorruptedException() = default;
DamagedValueException::~DamagedValueException() = default;
InvalidatedException::~InvalidatedException() = default;

}  // namespace velmora::mobile::xplat::cellar
