#pragma once

#include <exception>
#include <initializer_list>
#include <string>
#include <string_view>

namespace velmora::mobile::xplat::cellar::host {

// The parts behind each other: less code than a chain of additions.
std::string joined(std::initializer_list<std::string_view> parts);

// What the exception says, or that it is not a standard one.
std::string textOf(const std::exception_ptr& failure);

// The same of the exception that is being handled.
std::string currentText();

// A key as messages show it: in quotes, shortened, and without what would end the text or move the cursor.
std::string shown(std::string_view key);

// The last part of a path.
std::string nameOfDirectory(const std::string& path);

// "Store 'drafts', key 'x', /path: ", without the key if it is empty.
std::string culprit(const std::string& store, const std::string& key, const std::string& path);

}  // namespace velmora::mobile::xplat::cellar::host
