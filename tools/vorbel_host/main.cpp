// vorbel_host: a host process for vorbel.dll, and the demo and test tool.
//
// It loads the component the way a product does (the header-only loader of
// <vorbel/host.h>, nothing linked), builds one bus from a JSON configuration,
// observes the bus and its gateway, and runs commands from --exec arguments
// and standard input. Notifications arrive on the component's notifier
// threads and are printed one line at a time (console.h); commands run on the
// main thread.
#include "commands.h"
#include "configuration.h"
#include "console.h"
#include "observed.h"
#include "text.h"

#include <vorbel/host.h>

#include <fcntl.h>
#include <io.h>
#include <windows.h>

#include <cstdio>
#include <optional>
#include <string>
#include <vector>

namespace vorbel_host {
namespace {

enum exit_code : int {
  exit_ok = 0,
  exit_command_failed = 1,
  exit_usage = 2,
  exit_component = 3,
};

const char* const default_bus_name = "main";
// Longest command line read from standard input; longer lines are refused.
constexpr std::size_t max_line = 64 * 1024;

const char usage_text[] =
    "usage: vorbel_host [options]\n"
    "\n"
    "Loads vorbel.dll, creates one bus, prints every listener and connection\n"
    "notification, and runs commands from --exec arguments and standard input.\n"
    "\n"
    "options:\n"
    "  --config FILE     bus configuration (JSON, see below); without it the bus\n"
    "                    has no channels and no gateway\n"
    "  --bus NAME        bus name; overrides \"bus\" of the configuration\n"
    "                    (default: main)\n"
    "  --dll-dir DIR     folder holding vorbel.dll and its sibling libraries\n"
    "                    (default: this program's folder)\n"
    "  --exec COMMAND    run COMMAND (one command with its arguments, quoted);\n"
    "                    repeatable, run in order; standard input is then not\n"
    "                    read unless --stdin is given\n"
    "  --stdin           read commands from standard input after the --exec ones\n"
    "  --json            print one JSON object per line instead of text\n"
    "  --echo            print each command before running it (\"> command\")\n"
    "  --keep-going      go on after a failed command (the exit code stays 1)\n"
    "  --log FILE        write the component's log to FILE (\"-\": standard error);\n"
    "                    sets SCRIBO_LOG_FILE before the library is loaded\n"
    "  --help, -h        this text\n"
    "\n"
    "commands:\n"
    "%COMMANDS%"
    "\n"
    "output (text; --json gives the same as objects with an \"event\" member):\n"
    "  log: FILE                          where the component's log goes\n"
    "  ready bus=NAME pid=PID gateway=yes|no   the bus is up; commands are read\n"
    "  + pid=PID channel=CH id=ID         a listener appeared (new_listener)\n"
    "  - pid=PID channel=CH id=ID         a listener went away (listener_removed)\n"
    "  listen pipe=NAME                   the gateway serves a pipe\n"
    "  connect|start|disconnect local|remote pipe=NAME pid=PID\n"
    "  error local|remote pipe=NAME pid=PID err=CODE\n"
    "                                     gateway connection events (\"local\": a\n"
    "                                     pipe this process serves)\n"
    "  admission local|remote ALLOW|DENY pid=PID pipe=NAME level=L trust=T\n"
    "      verification=NAME(0xCODE) signer=\"S\" own_signer=\"S\" image=\"PATH\"\n"
    "      source=SRC reason=WORD \"TEXT\"\n"
    "                                     every admission decision of the gateway,\n"
    "                                     on one line; `trust` prints the same after\n"
    "                                     \"trust ALLOW|DENY\"\n"
    "  Blanks and control bytes in names are written as \\xNN. Errors go to\n"
    "  standard error as \"vorbel_host: ...\".\n"
    "\n"
    "configuration (JSON object; every member optional):\n"
    "  {\n"
    "    \"bus\": \"main\",\n"
    "    \"default\": true,\n"
    "    \"protected_image_paths\": false,\n"
    "    \"local_channels\": [\"alerts\"],\n"
    "    \"exported_channels\": [{\"channel\": \"alerts\", \"pipe\": \"\\\\\\\\.\\\\PIPE\\\\vorbel_demo\",\n"
    "                           \"link_type\": 3, \"security\": 0}],\n"
    "    \"imported_channels\": [{\"channel\": \"alerts\", \"pipe\": \"\\\\\\\\.\\\\PIPE\\\\vorbel_demo\",\n"
    "                           \"link_type\": 3, \"security\": 0,\n"
    "                           \"remote_channel\": \"alerts\", \"remote_bus\": \"main\"}]\n"
    "  }\n"
    "  link_type defaults to 3, security to 0 (0: peers signed like this process;\n"
    "  1: also other validly signed peers), for the clients of an exported pipe\n"
    "  and the server of an imported one. protected_image_paths: admit only peers\n"
    "  whose user cannot change their image's path. tools/vorbel_host/README.md\n"
    "  has more.\n"
    "\n"
    "exit codes:\n"
    "  0  every command succeeded\n"
    "  1  a command failed or a wait timed out\n"
    "  2  bad usage or a bad configuration file\n"
    "  3  vorbel.dll could not be loaded or the bus could not be created\n";

struct options {
  std::optional<std::wstring> config;
  std::optional<std::string> bus;
  std::optional<std::wstring> dll_dir;
  std::vector<std::string> exec;
  std::optional<std::wstring> log;
  bool read_stdin = false;
  bool json = false;
  bool echo = false;
  bool keep_going = false;
  bool help = false;
};

struct usage_error {
  std::string message;
};

// Splits the command line by the rules of the C runtime (2n backslashes and
// a quote: n backslashes and a quote toggle; 2n+1: n and a literal quote).
// Done here rather than with CommandLineToArgvW: shell32 alone costs a Wine
// process about 0.4 s to load, and every test run starts this program.
std::vector<std::wstring> command_line_args() {
  const wchar_t* p = ::GetCommandLineW();
  std::vector<std::wstring> args;
  // The program name ends at the first blank outside quotes; no escapes.
  bool quoted = false;
  while (*p != L'\0' && (quoted || (*p != L' ' && *p != L'\t'))) {
    if (*p == L'"') quoted = !quoted;
    ++p;
  }
  for (;;) {
    while (*p == L' ' || *p == L'\t') ++p;
    if (*p == L'\0') break;
    std::wstring arg;
    quoted = false;
    while (*p != L'\0' && (quoted || (*p != L' ' && *p != L'\t'))) {
      std::size_t backslashes = 0;
      while (*p == L'\\') {
        ++backslashes;
        ++p;
      }
      if (*p == L'"') {
        arg.append(backslashes / 2, L'\\');
        if (backslashes % 2 == 1) {
          arg += L'"';
        } else if (quoted && p[1] == L'"') {
          arg += L'"';  // "" inside quotes is a literal quote
          ++p;
        } else {
          quoted = !quoted;
        }
        ++p;
      } else {
        arg.append(backslashes, L'\\');
        if (*p != L'\0' && (quoted || (*p != L' ' && *p != L'\t'))) arg += *p++;
      }
    }
    args.push_back(std::move(arg));
  }
  return args;
}

options parse_options(const std::vector<std::wstring>& args) {
  options opts;
  for (std::size_t i = 0; i < args.size(); ++i) {
    std::wstring name = args[i];
    std::optional<std::wstring> inline_value;
    if (name.rfind(L"--", 0) == 0) {
      const std::size_t equals = name.find(L'=');
      if (equals != std::wstring::npos) {
        inline_value = name.substr(equals + 1);
        name.resize(equals);
      }
    }
    auto value = [&]() -> std::wstring {
      if (inline_value) return *inline_value;
      if (i + 1 >= args.size()) throw usage_error{to_utf8(name) + " needs a value"};
      return args[++i];
    };
    auto flag = [&](bool& target) {
      if (inline_value) throw usage_error{to_utf8(name) + " takes no value"};
      target = true;
    };

    if (name == L"--config") {
      opts.config = value();
    } else if (name == L"--bus") {
      const std::string bus = to_utf8(value());
      if (bus.empty()) throw usage_error{"--bus needs a non-empty name"};
      opts.bus = bus;
    } else if (name == L"--dll-dir") {
      opts.dll_dir = value();
    } else if (name == L"--exec") {
      opts.exec.push_back(to_utf8(value()));
    } else if (name == L"--log") {
      opts.log = value();
      if (opts.log->empty()) throw usage_error{"--log needs a file name (or - for standard error)"};
    } else if (name == L"--stdin") {
      flag(opts.read_stdin);
    } else if (name == L"--json") {
      flag(opts.json);
    } else if (name == L"--echo") {
      flag(opts.echo);
    } else if (name == L"--keep-going") {
      flag(opts.keep_going);
    } else if (name == L"--help" || name == L"-h" || name == L"/?") {
      flag(opts.help);
    } else {
      throw usage_error{"unknown option \"" + to_utf8(args[i]) + "\""};
    }
  }
  return opts;
}

std::wstring module_path(HMODULE module) {
  std::wstring path(MAX_PATH, L'\0');
  for (;;) {
    const DWORD n = ::GetModuleFileNameW(module, &path[0], static_cast<DWORD>(path.size()));
    if (n == 0) return std::wstring();
    if (n < path.size()) {
      path.resize(n);
      return path;
    }
    if (path.size() >= 32768) return std::wstring();
    path.resize(path.size() * 2);
  }
}

std::wstring folder_of(const std::wstring& path) {
  const std::size_t slash = path.find_last_of(L"\\/");
  return slash == std::wstring::npos ? std::wstring(L".") : path.substr(0, slash);
}

std::wstring stem_of(const std::wstring& path) {
  const std::size_t slash = path.find_last_of(L"\\/");
  std::wstring name = slash == std::wstring::npos ? path : path.substr(slash + 1);
  const std::size_t dot = name.rfind(L'.');
  if (dot != std::wstring::npos) name.resize(dot);
  return name;
}

std::optional<std::wstring> environment(const wchar_t* name) {
  const DWORD needed = ::GetEnvironmentVariableW(name, nullptr, 0);
  if (needed == 0) return std::nullopt;
  std::wstring value(needed, L'\0');
  const DWORD n = ::GetEnvironmentVariableW(name, &value[0], needed);
  if (n == 0 || n >= needed) return std::nullopt;
  value.resize(n);
  return value;
}

std::wstring full_path(const std::wstring& path) {
  const DWORD needed = ::GetFullPathNameW(path.c_str(), 0, nullptr, nullptr);
  if (needed == 0) return path;
  std::wstring full(needed, L'\0');
  const DWORD n = ::GetFullPathNameW(path.c_str(), needed, &full[0], nullptr);
  if (n == 0 || n >= needed) return path;
  full.resize(n);
  return full;
}

// Where the logging library will write: SCRIBO_LOG_FILE (set here from
// --log, or inherited), otherwise the library's own default,
// %TEMP%\scribo\<program>-<pid>.log. "-" is standard error.
std::wstring prepare_log(const options& opts) {
  if (opts.log) {
    const std::wstring target = *opts.log == L"-" ? *opts.log : full_path(*opts.log);
    ::SetEnvironmentVariableW(L"SCRIBO_LOG_FILE", target.c_str());
    return target;
  }
  if (auto inherited = environment(L"SCRIBO_LOG_FILE"); inherited && !inherited->empty()) {
    return *inherited;
  }
  wchar_t temp[MAX_PATH + 2] = {};
  const DWORD n = ::GetTempPathW(MAX_PATH + 1, temp);
  if (n == 0 || n > MAX_PATH + 1) return L"-";
  std::wstring folder(temp, n);
  if (folder.back() != L'\\') folder += L'\\';
  return folder + L"scribo\\" + stem_of(module_path(nullptr)) + L"-" +
         std::to_wstring(::GetCurrentProcessId()) + L".log";
}

enum class read_result { line, too_long, end };

read_result read_line(std::FILE* in, std::string& line) {
  line.clear();
  int ch = 0;
  while ((ch = std::getc(in)) != EOF) {
    if (ch == '\n') return read_result::line;
    if (line.size() >= max_line) {
      while ((ch = std::getc(in)) != EOF && ch != '\n') {
      }
      return read_result::too_long;
    }
    line.push_back(static_cast<char>(ch));
  }
  return line.empty() ? read_result::end : read_result::line;
}

// One loaded component and one use of one bus, with the host's observers on
// the bus and its gateway. Owned by run() on the main thread. Teardown runs
// in the only safe order: observers off (remove_observer waits for a
// notification in progress), then the bus, then the library.
class bus_session {
 public:
  bus_session(vorbel::host_library& library, std::string name)
      : library_(library), name_(std::move(name)) {}
  bus_session(const bus_session&) = delete;
  bus_session& operator=(const bus_session&) = delete;

  ~bus_session() {
    if (gateway_observer_ != nullptr) {
      observable_gateway()->remove_observer(gateway_observer_, /* context */ 0);
    }
    if (bus_observer_ != nullptr) bus_->remove_observer(bus_observer_, /* context */ 0);
    if (bus_ != nullptr) library_.registry()->destroy_bus(name_.c_str());
    library_.close();
  }

  ibus* create(ibus_configuration* provider) {
    bus_ = library_.registry()->create_bus(name_.c_str(), provider);
    if (bus_ != nullptr) gateway_ = library_.registry()->get_gateway(name_.c_str());
    return bus_;
  }
  bool has_gateway() const { return gateway_ != nullptr; }
  // The gateway's trust explainer face; null without a gateway.
  igateway_trust_explainer* explainer() const {
    return gateway_ != nullptr
               ? static_cast<igateway_trust_explainer*>(gateway_->GetInterface(IID_igateway_trust_explainer))
               : nullptr;
  }

  bool observe_bus(ibus_observer_base* observer) {
    if (!bus_->add_observer(observer, /* context */ 0)) return false;
    bus_observer_ = observer;
    return true;
  }
  bool observe_gateway(igateway_observer_base* observer) {
    if (!observable_gateway()->add_observer(observer, /* context */ 0)) return false;
    gateway_observer_ = observer;
    return true;
  }

 private:
  // The gateway's registration face is its second base.
  qm::iobservable<igateway_observer_base*>* observable_gateway() const {
    return static_cast<qm::iobservable<igateway_observer_base*>*>(gateway_);
  }

  vorbel::host_library& library_;
  const std::string name_;
  ibus* bus_ = nullptr;
  igateway* gateway_ = nullptr;
  ibus_observer_base* bus_observer_ = nullptr;
  igateway_observer_base* gateway_observer_ = nullptr;
};

int run(const options& opts, const std::vector<command>& exec_commands, const bus_config& config) {
  console out(opts.json ? console::format::json : console::format::text);

  const std::string bus_name = opts.bus ? *opts.bus : config.bus ? *config.bus : default_bus_name;
  const std::wstring log = prepare_log(opts);
  out.emit("log: " + (log == L"-" ? std::string("standard error") : to_utf8(log)),
           nlohmann::ordered_json{{"event", "log"}, {"file", to_utf8(log)}});

  // Destroyed in reverse: the session (observers off, bus, library) goes
  // before the observers and the state they write to.
  observed_state state(out);
  bus_watch bus_observer(state);
  gateway_watch gateway_observer(state);
  vorbel::host_library library;

  const std::wstring dll_dir = opts.dll_dir ? *opts.dll_dir : folder_of(module_path(nullptr));
  if (const std::uint32_t err = library.open(dll_dir)) {
    out.error("cannot load vorbel.dll from \"" + to_utf8(dll_dir) + "\": " + describe_error(err));
    return exit_component;
  }
  bus_session session(library, bus_name);
  json_configuration provider(config);
  ibus* const bus = session.create(&provider);
  if (bus == nullptr) {
    out.error("create_bus(\"" + bus_name + "\") failed; the component's log has the cause (" +
              (log == L"-" ? std::string("standard error") : to_utf8(log)) + ")");
    return exit_component;
  }
  if (!config.exported_channels.empty() || !config.imported_channels.empty()) {
    if (!session.has_gateway()) {
      out.warning("the configuration exports or imports channels but the bus has no gateway; "
                  "the component's log says why");
    }
  }
  if (!session.observe_bus(&bus_observer) ||
      (session.has_gateway() && !session.observe_gateway(&gateway_observer))) {
    out.error("cannot add the host's observers");
    return exit_component;
  }

  const std::uint32_t pid = ::GetCurrentProcessId();
  out.emit("ready bus=" + printable(bus_name) + " pid=" + std::to_string(pid) +
               " gateway=" + (session.has_gateway() ? "yes" : "no"),
           nlohmann::ordered_json{{"event", "ready"},
                                  {"bus", bus_name},
                                  {"pid", pid},
                                  {"gateway", session.has_gateway()}});

  command_runner runner(bus, session.has_gateway(), session.explainer(), state, out);
  bool failed = false;
  // False: stop reading commands.
  auto execute = [&](const command& c) {
    if (opts.echo) {
      out.emit("> " + c.line, nlohmann::ordered_json{{"event", "command"}, {"line", c.line}});
    }
    const auto result = runner.run(c);
    if (result == command_runner::outcome::quit) return false;
    if (result == command_runner::outcome::failed) {
      failed = true;
      return opts.keep_going;
    }
    return true;
  };

  bool go_on = true;
  for (const command& c : exec_commands) {
    if (!(go_on = execute(c))) break;
  }
  if (go_on && (exec_commands.empty() || opts.read_stdin)) {
    ::_setmode(::_fileno(stdin), _O_BINARY);
    std::string line;
    for (;;) {
      const read_result got = read_line(stdin, line);
      if (got == read_result::end) break;
      if (got == read_result::too_long) {
        out.error("a command line is longer than " + std::to_string(max_line) + " bytes");
        failed = true;
        if (!opts.keep_going) break;
        continue;
      }
      const parsed_line parsed = parse_command(line, pid);
      if (const auto* bad = std::get_if<bad_command>(&parsed)) {
        out.error(bad->message);
        failed = true;
        if (!opts.keep_going) break;
        continue;
      }
      if (const auto* c = std::get_if<command>(&parsed)) {
        if (!execute(*c)) break;
      }
    }
  }
  return failed ? exit_command_failed : exit_ok;
}

int host_main() {
  // Lines end in "\n" only, on a console as on a pipe read by a script.
  ::_setmode(::_fileno(stdout), _O_BINARY);
  ::_setmode(::_fileno(stderr), _O_BINARY);
  options opts;
  std::vector<command> exec_commands;
  try {
    opts = parse_options(command_line_args());
    if (opts.help) {
      std::string text = usage_text;
      text.replace(text.find("%COMMANDS%"), 10, commands_help());
      std::fwrite(text.data(), 1, text.size(), stdout);
      std::fflush(stdout);
      return exit_ok;
    }
    // Every --exec command is checked before anything is loaded.
    for (const std::string& line : opts.exec) {
      const parsed_line parsed = parse_command(line, ::GetCurrentProcessId());
      if (const auto* bad = std::get_if<bad_command>(&parsed)) {
        throw usage_error{"--exec \"" + line + "\": " + bad->message};
      }
      if (const auto* c = std::get_if<command>(&parsed)) exec_commands.push_back(*c);
    }
  } catch (const usage_error& e) {
    std::fprintf(stderr, "vorbel_host: %s (see --help)\n", e.message.c_str());
    return exit_usage;
  }

  bus_config config;
  if (opts.config) {
    try {
      config = load_configuration(*opts.config);
    } catch (const config_error& e) {
      std::fprintf(stderr, "vorbel_host: configuration \"%s\": %s\n",
                   to_utf8(*opts.config).c_str(), e.what());
      return exit_usage;
    }
  }
  return run(opts, exec_commands, config);
}

}  // namespace
}  // namespace vorbel_host

int main() {
  try {
    return vorbel_host::host_main();
  } catch (const std::exception& e) {
    std::fprintf(stderr, "vorbel_host: %s\n", e.what());
    return vorbel_host::exit_command_failed;
  }
}
