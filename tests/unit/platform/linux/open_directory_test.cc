// Opening a directory with no link on the way, by the single call and component by component.
#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>

#include <gtest/gtest.h>

#include "platform/linux/os_system.h"
#include "test_files.h"

namespace brisvale::os {
namespace {

TEST(OpenDirectoryNoLinks, RefusesLinksAnywhereOnTheWay) {
  brisvale::testing::ScratchDir scratch;
  const std::filesystem::path root = scratch.path();
  std::filesystem::create_directories(root / "a/b");
  std::filesystem::create_directory_symlink(root / "a", root / "link");
  brisvale::testing::WriteFileBytes(root / "file", {});
  const struct {
    std::string path;
    int result;  // 0 for a descriptor
  } cases[] = {
      {(root / "a/b").string(), 0},
      {(root / "a//b/").string(), 0},
      {"/", 0},
      {(root / "link").string(), -ENOTDIR},
      {(root / "link/b").string(), -ELOOP},
      {(root / "a/../link/b").string(), -ELOOP},
      {(root / "missing").string(), -ENOENT},
      {(root / "file").string(), -ENOTDIR},
  };
  for (const bool byComponents : {false, true}) {
    for (const auto& c : cases) {
      SCOPED_TRACE(c.path + (byComponents ? " by components" : ""));
      const int fd = OpenDirectoryNoLinks(c.path.c_str(), byComponents);
      if (fd >= 0) {
        EXPECT_EQ(::fcntl(fd, F_GETFL) & O_ACCMODE, O_RDONLY);
        ::close(fd);
      }
      EXPECT_EQ(fd >= 0 ? 0 : fd, c.result);
    }
  }
}

}  // namespace
}  // namespace brisvale::os
