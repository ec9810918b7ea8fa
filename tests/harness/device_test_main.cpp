// Test main for programs that use the fake device root: the whole process moves into a
// private mount namespace first, so that its mounts never reach the host and vanish with it.
#include <gtest/gtest.h>
#include <sched.h>
#include <stdio.h>
#include <sys/mount.h>
#include <unistd.h>

int main(int argc, char** argv) {
  testing::InitGoogleTest(&argc, argv);
  if (geteuid() == 0) {
    if (unshare(CLONE_NEWNS) != 0 || mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr)) {
      perror("private mount namespace");
      return 1;
    }
  }
  return RUN_ALL_TESTS();
}
