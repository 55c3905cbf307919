// A check that holds for every input a fuzzer is given. A failure prints the
// condition and aborts, which libFuzzer reports as a crash and keeps the
// input that caused it.
#pragma once

#include <cstdio>
#include <cstdlib>

#define FUZZ_CHECK(condition)                                                                \
  do {                                                                                       \
    if (!(condition)) {                                                                      \
      std::fprintf(stderr, "%s:%d: check failed: %s\n", __FILE__, __LINE__, #condition);  \
      std::abort();                                                                          \
    }                                                                                        \
  } while (false)
