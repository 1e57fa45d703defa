// Entry point of every test program: sets up the sandbox before gtest and
// before any thread exists, then runs the tests.

#include <stdio.h>

#include <gmock/gmock.h>

#include "support/sandbox.h"

int main(int argc, char** argv) {
  if (!zorv_test::EnterSandbox()) {
    fprintf(stderr, "sandbox unavailable: %s; tests that need it are skipped\n",
            zorv_test::SandboxSkipReason());
  }
  testing::InitGoogleMock(&argc, argv);
  return RUN_ALL_TESTS();
}
