#include "host/DirectoryPathLocations.h"

#include <gtest/gtest.h>

#include <stdexcept>
#include <string>

#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar::host {
namespace {

TEST(DirectoryPathLocations, EachAreaIsADirectoryOfTheRoot) {
  DirectoryPathLocations locations("/data/app");
  EXPECT_EQ(locations.pathForArea(Area::Caches, ""), "/data/app/caches");
  EXPECT_EQ(locations.pathForArea(Area::Documents, ""), "/data/app/documents");
  EXPECT_EQ(locations.pathForArea(Area::Shared, ""), "/data/app/shared");
}

TEST(DirectoryPathLocations, TheSessionKeyPlaysNoPart) {
  DirectoryPathLocations locations("/data/app");
  EXPECT_EQ(locations.pathForArea(Area::Caches, "alice"), locations.pathForArea(Area::Caches, "bob"));
}

TEST(DirectoryPathLocations, ARootThatEndsWithASlashGetsNoSecondOne) {
  EXPECT_EQ(DirectoryPathLocations("/data/").pathForArea(Area::Shared, ""), "/data/shared");
  EXPECT_EQ(DirectoryPathLocations("/").pathForArea(Area::Shared, ""), "/shared");
}

TEST(DirectoryPathLocations, AnEmptyRootIsTheWorkingDirectory) {
  EXPECT_EQ(DirectoryPathLocations("").pathForArea(Area::Caches, ""), "caches");
}

TEST(DirectoryPathLocations, AValueThatIsNoAreaThrows) {
  DirectoryPathLocations locations("/data");
  try {
    locations.pathForArea(static_cast<Area>(3), "");
    FAIL() << "There is no fourth area.";
  } catch (const std::invalid_argument& error) {
    EXPECT_STREQ(error.what(), "Unknown area 3.");
  }
}

TEST(DirectoryPathLocations, CreatesNothing) {
  const test::TemporaryDirectory directory;
  DirectoryPathLocations locations(directory.path());
  locations.pathForArea(Area::Caches, "");
  EXPECT_TRUE(directory.names().empty());
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::host
