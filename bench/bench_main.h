// The subcommands of vorbel_bench. Each prints a markdown section on
// standard output and returns the process exit code (0, or 1 when the
// benchmark could not run; a missed goal is reported, not an error).
#pragma once

#include <cstddef>
#include <string>
#include <vector>

namespace bench {

int run_transport();
int run_propagation();
// `label`, when not empty, names the run in its title ("under load").
int run_convergence(const std::vector<std::size_t>& sizes, const std::string& label);
int run_flood();
int run_codec();
int run_admission();
// Gateway notifications with admission observers (admission_events.cpp).
int run_admission_events();
int run_local();
// The peer role (peer.cpp).
int run_peer();

// "SCRIBO_LOG_LEVEL=off", or how the logging library is set up when the
// variable is not set, for the reports.
std::string logging_setting();

}  // namespace bench
