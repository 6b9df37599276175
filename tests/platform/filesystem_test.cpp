#include "kavo/filesystem.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include "support/temp_folder.h"

TEST(KAVOFSDirIsMntPoint, TellsMountPoints) {
  const TempFolder folder;
  ASSERT_EQ(symlink("/proc", (folder / "link").c_str()), 0);
  EXPECT_EQ(KAVOFSDirIsMntPoint("/proc/"), 1);
  EXPECT_EQ(KAVOFSDirIsMntPoint(folder.Path().c_str()), 0);
  EXPECT_EQ(KAVOFSDirIsMntPoint((folder / "link").c_str()), 0);
  EXPECT_EQ(KAVOFSDirIsMntPoint((folder / "missing").c_str()), -1);
}
