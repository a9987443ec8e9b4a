#include "AttributeStore.h"

#include <glog/logging.h>

#include <exception>
#include <vector>

#include "FileUtils.h"
#include "JsonValue.h"
#include "LarderException.h"

namespace velmora::mobile::xplat::cellar {

const std::string AttributeStore::fileName = "_cellar_extended_attributes";

AttributeStore::AttributeStore(const std::shared_ptr<FileUtils>& fileUtils) : fileUtils_(fileUtils) {}

AttributeStore::~AttributeStore() = default;

void AttributeStore::set(const std::string& directory, const JsonValue& value) {
  try {
    const std::string path = pathFor(directory);
    if (!fileUtils_->pathExists(directory) || !fileUtils_->isDirectory(directory)) return;
    const std::string text = value.dump();
    fileUtils_->writeFile(path, std::vector<unsigned char>(text.begin(), text.end()));
  } catch (const std::exception& error) {
    LOG(ERROR) << "Could not set attributes: " << error.what();
  }
}

JsonValue AttributeStore::get(const std::string& directory) {
  try {
    const std::string path = pathFor(directory);
    if (!fileUtils_->pathExists(path)) return JsonValue::object();
    const std::vector<unsigned char> bytes = fileUtils_->readFile(path);
    // As a string, like the configuration: each further kind of input costs an instance of the whole parser.
    return JsonValue::parse(std::string(bytes.begin(), bytes.end()));
  } catch (const FileUtilsIoException& error) {
    LOG(ERROR) << "Could not get attributes: " << error.what();
  } catch (const std::exception& error) {
    LOG(ERROR) << "Read invalid json from disk: " << error.what();
  }
  return JsonValue::object();
}

void AttributeStore::remove(const std::string& directory) {
  try {
    const std::string path = pathFor(directory);
    if (fileUtils_->pathExists(path)) fileUtils_->deleteFile(path);
  } catch (const std::exception& error) {
    LOG(ERROR) << "Could not remove attributes: " << error.what();
  }
}

std::string AttributeStore::pathFor(const std::string& directory) {
  return fileUtils_->combinePath(directory, fileName);
}

}  // namespace velmora::mobile::xplat::cellar
