// A folder of the test's own, and the fakes for what the platform logs.
#pragma once

#include <gmock/gmock.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>

#include "tests/fakes/FakePlatform.h"

namespace vx::lnx {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

class Folder {
 public:
  Folder() {
    std::string pattern = "/tmp/vxtest-XXXXXX";
    folder = mkdtemp(pattern.data());
  }
  ~Folder() { std::filesystem::remove_all(folder); }
  void write(const std::string& name, const std::string& text) {
    std::filesystem::create_directories(std::filesystem::path(folder + "/" + name).parent_path());
    std::ofstream(folder + "/" + name) << text;
  }
  std::string read(const std::string& name) {
    std::stringstream text;
    text << std::ifstream(folder + "/" + name).rdbuf();
    return text.str();
  }
  std::string folder;
};

class FolderTest : public ::testing::Test, protected Folder {
 protected:
  fakes::FakePlatform p;
};

}  // namespace vx::lnx
