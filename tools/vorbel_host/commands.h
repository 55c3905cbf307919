// The host's commands: parsing one line, and running it against the bus.
//
// command_runner is owned by main and used only on the command thread (the
// --exec arguments, then standard input). It calls the component without
// holding any lock of the host.
#pragma once

#include "console.h"
#include "observed.h"

#include <vorbel/ibus.h>
#include <vorbel/igateway_admission.h>

#include <cstdint>
#include <optional>
#include <string>
#include <variant>

namespace vorbel_host {

// Waits without a timeout argument end after this long.
inline constexpr std::uint32_t default_wait_ms = 10000;
// Longest sleep or wait a command may ask for: one day.
inline constexpr std::uint32_t max_wait_ms = 24u * 60u * 60u * 1000u;

struct command {
  enum class verb {
    register_listener,
    unregister_listener,
    registered,
    list,
    connections,
    sleep,
    wait_for,
    wait_for_absent,
    trust,
    echo,
    help,
    quit,
  };
  verb what = verb::help;
  std::string channel;
  std::string id;
  std::optional<std::uint32_t> pid;  // wait-for: empty means any process; trust: the process
  std::uint32_t ms = 0;              // sleep, or the wait's timeout
  std::uint32_t level = 0;           // trust: the pipe security level
  std::string text;                  // echo; trust: the image path when no pid
  std::string line;                  // as written, for messages
};

// Nothing to run: a blank line or a comment ("# ...").
struct no_command {};
// A line that is not a valid command; the message says why.
struct bad_command {
  std::string message;
};

using parsed_line = std::variant<command, no_command, bad_command>;

// `self_pid` replaces the PID word "self".
parsed_line parse_command(const std::string& line, std::uint32_t self_pid);

// The commands, one line each, for --help and the help command.
const char* commands_help();

class command_runner {
 public:
  enum class outcome { ok, failed, quit };

  // `explainer` is the gateway's trust explainer, null without a gateway.
  command_runner(ibus* bus, bool has_gateway, igateway_trust_explainer* explainer, observed_state& state,
                 console& out)
      : bus_(bus), explainer_(explainer), has_gateway_(has_gateway), state_(state), out_(out) {}

  // Runs one command; a failure has been written to standard error.
  outcome run(const command& c);

 private:
  outcome explain(const command& c);

  ibus* const bus_;
  igateway_trust_explainer* const explainer_;
  const bool has_gateway_;
  observed_state& state_;
  console& out_;
};

}  // namespace vorbel_host
