// A target as a plain program: runs the inputs that are named, or lie in the directories that are named, once each. So
// every compiler and every machine can run them, with any sanitizer or none.

#include <algorithm>
#include <cstdint>
#include <exception>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <iterator>
#include <stdexcept>
#include <string>
#include <vector>

#include "harness/Fuzzing.h"

namespace {

namespace fs = std::filesystem;

std::vector<fs::path> inputsIn(const fs::path& path) {
  if (!fs::is_directory(path)) return {path};
  std::vector<fs::path> inputs;
  for (const auto& entry : fs::directory_iterator(path)) {
    if (entry.is_regular_file()) inputs.push_back(entry.path());
  }
  std::sort(inputs.begin(), inputs.end());
  return inputs;
}

void replay(const fs::path& input) {
  std::ifstream stream(input, std::ios::binary);
  if (!stream) throw std::runtime_error("Cannot read " + input.string());
  const std::string text{std::istreambuf_iterator<char>(stream), std::istreambuf_iterator<char>()};
  const std::vector<std::uint8_t> bytes(text.begin(), text.end());
  std::cout << input.filename().string() << std::endl;  // said before, so that a crash has a name
  (void)LLVMFuzzerTestOneInput(bytes.data(), bytes.size());
}

void run(int argumentCount, char** arguments) {
  (void)LLVMFuzzerInitialize(&argumentCount, &arguments);
  std::size_t count = 0;
  for (int i = 1; i < argumentCount; ++i) {
    for (const fs::path& input : inputsIn(arguments[i])) {
      replay(input);
      ++count;
    }
  }
  if (count == 0) throw std::runtime_error("No inputs: name files or directories.");
  std::cout << count << " inputs" << std::endl;
}

}  // namespace

int main(int argumentCount, char** arguments) {
  try {
    run(argumentCount, arguments);
  } catch (const std::exception& error) {
    std::cerr << error.what() << std::endl;
    return 1;
  }
  return 0;
}
