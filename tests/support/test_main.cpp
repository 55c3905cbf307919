// Main of the test programs: binds the logging library for the whole run, as
// vorbel.dll's process attach does for a host.
#include <gtest/gtest.h>

#include "logging/log_dll.h"

int main(int argc, char** argv) {
  ::testing::InitGoogleTest(&argc, argv);
  logging::process_attach();
  const int result = RUN_ALL_TESTS();
  logging::process_detach(/* process_terminating */ false);
  return result;
}
