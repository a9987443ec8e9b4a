#pragma once

#include <memory>
#include <string>

#include "Export.h"
#include "JsonValue.h"

namespace velmora::mobile::xplat::cellar {

class FileUtils;

// Keeps a small JSON document of attributes with a directory, in the file "_cellar_extended_attributes" inside it.
// There is one document for a directory: whoever sets it replaces what others had set. Keeps nothing in memory and
// takes no lock; callers that write one directory's attributes from several threads keep themselves apart. Never
// throws: a failure is one error line in the log, and a neutral result.
class CELLAR_EXPORT AttributeStore {
 public:
  // The name of the attributes file, which no key and no file of a host's should have.
  static const std::string fileName;

  explicit AttributeStore(const std::shared_ptr<FileUtils>& fileUtils);
  virtual ~AttributeStore();

  // Replaces the whole document. Does nothing for a path that is not an existing directory. Written in place: a crash
  // midway leaves a damaged document, which reads as none.
  virtual void set(const std::string& directory, const JsonValue& value);

  // The whole document, whatever its JSON type; an empty object when there is none or it cannot be read.
  virtual JsonValue get(const std::string& directory);

  // Deletes the document. Not an error: there is none.
  virtual void remove(const std::string& directory);

 private:
  std::string pathFor(const std::string& directory);

  const std::shared_ptr<FileUtils> fileUtils_;
};

}  // namespace velmora::mobile::xplat::cellar
