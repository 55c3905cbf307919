// vorbel_bench: benchmarks of the component against the raw transport.
//
//   vorbel_bench transport | propagation | convergence [--label TEXT] [N...] |
//                flood | codec | admission | local
//   vorbel_bench admission-events
//
// Each subcommand prints a markdown section; cross-process ones start this
// program again as their peer (`vorbel_bench peer`). Data for the plots go
// to files in the current folder. Run it through scripts/bench.sh.
#include <windows.h>

#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <string>
#include <vector>

#include "bench_main.h"
#include "codec_bench.h"
#include "logging/log_dll.h"

namespace bench {

int run_codec() {
  const auto rows = run_codec_bench({1, 10, 100, 1000});
  std::fputs(codec_markdown("mingw-w64 under Wine", rows).c_str(), stdout);
  std::ofstream("codec_wine.dat") << codec_data(rows);
  return 0;
}

}  // namespace bench

namespace {

int usage() {
  std::fputs("usage: vorbel_bench transport | propagation | convergence [--label TEXT] [N...] | flood | codec | "
             "admission | local\n",
             stderr);
  std::fputs("       vorbel_bench admission-events\n", stderr);
  return 2;
}

int dispatch(int argc, char** argv) {
  if (argc < 2) return usage();
  const std::string command = argv[1];
  if (command == "peer") return bench::run_peer();
  if (command == "transport") return bench::run_transport();
  if (command == "propagation") return bench::run_propagation();
  if (command == "flood") return bench::run_flood();
  if (command == "codec") return bench::run_codec();
  if (command == "admission") return bench::run_admission();
  if (command == "admission-events") return bench::run_admission_events();
  if (command == "local") return bench::run_local();
  if (command == "convergence") {
    std::vector<std::size_t> sizes;
    std::string label;
    for (int i = 2; i < argc; ++i) {
      if (std::string(argv[i]) == "--label" && i + 1 < argc) {
        label = argv[++i];
        continue;
      }
      char* end = nullptr;
      const unsigned long long n = std::strtoull(argv[i], &end, 10);
      if (end == argv[i] || *end != '\0' || n == 0 || n > 100000) return usage();
      sizes.push_back(static_cast<std::size_t>(n));
    }
    if (sizes.empty()) sizes = {1000, 5000, 10000, 20000};
    return bench::run_convergence(sizes, label);
  }
  return usage();
}

}  // namespace

int main(int argc, char** argv) {
  // Binds the logging library for the run, as the component's process
  // attach does in a host.
  logging::process_attach();
  const int result = dispatch(argc, argv);
  logging::process_detach(/* process_terminating */ false);
  return result;
}
