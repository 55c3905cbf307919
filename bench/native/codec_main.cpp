// codec_bench_native [DATA_FILE]: the codec table for the native build on
// standard output; the per-listener costs for the plot in DATA_FILE.
#include <cstdio>
#include <fstream>

#include "codec_bench.h"

int main(int argc, char** argv) {
  const auto rows = bench::run_codec_bench({1, 10, 100, 1000});
  std::fputs(bench::codec_markdown("native (g++, Linux)", rows).c_str(), stdout);
  if (argc > 1) std::ofstream(argv[1]) << bench::codec_data(rows);
  return 0;
}
