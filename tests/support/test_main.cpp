// Entry point of every test executable: keeps the platform folders (logs,
// the default database root) inside a temporary folder of the process, so
// that no test touches the real defaults.

#include <gtest/gtest.h>

#include "framework/platform.h"
#include "support/temp_dir.h"

int main(int argc, char** argv) {
  ::testing::InitGoogleTest(&argc, argv);
  testing_support::TempDir home;
  Platform::inst().changeSystemConfigDir(home / "home");
  Platform::inst().changeLogDir(home / "log");
  return RUN_ALL_TESTS();
}
