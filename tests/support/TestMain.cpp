#include <gtest/gtest.h>

// Shared main for every test executable: GoogleTest's own, kept here so that test binaries link
// the fakes library alone.
int main(int argc, char** argv) {
  ::testing::InitGoogleTest(&argc, argv);
  return RUN_ALL_TESTS();
}
