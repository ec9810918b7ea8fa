// Test main for programs that use the fake device root: the whole process moves into a
// private mount namespace first, so that its mounts never reach the host and vanish with it.
#include <gtest/gtest.h>

#include <string>

#include "tests/harness/fake_device.h"

int main(int argc, char** argv) {
  testing::InitGoogleTest(&argc, argv);
  // Without root the device tests skip themselves.
  std::string why;
  if (fake_device_supported(&why) && !enter_private_mount_namespace("private mount namespace")) {
    return 1;
  }
  return RUN_ALL_TESTS();
}
