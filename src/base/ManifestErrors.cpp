#include "base/ManifestErrors.h"

#include "LarderException.h"

namespace velmora::mobile::xplat::cellar {

void translatingManifestErrors(FunctionReference action) {
  try {
    action();
  } catch (const SQLiteStoreCorruptedException& error) {
    throw ManifestCorruptedException(error.description(), error.code());
  } catch (const SQLiteStoreException& error) {
    throw ManifestPersistenceException(error.description(), error.code());
  }
}

}  // namespace velmora::mobile::xplat::cellar
