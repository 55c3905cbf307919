#include "commands.h"

#include "text.h"

#include <chrono>
#include <thread>
#include <vector>

namespace vorbel_host {
namespace {

using nlohmann::ordered_json;

std::vector<std::string> split_words(const std::string& line) {
  std::vector<std::string> words;
  std::size_t i = 0;
  while (i < line.size()) {
    while (i < line.size() && (line[i] == ' ' || line[i] == '\t')) ++i;
    const std::size_t start = i;
    while (i < line.size() && line[i] != ' ' && line[i] != '\t') ++i;
    if (i > start) words.push_back(line.substr(start, i - start));
  }
  return words;
}

struct verb_info {
  const char* word;
  command::verb what;
  std::size_t min_args;
  std::size_t max_args;
  const char* usage;
};

const verb_info verbs[] = {
    {"register", command::verb::register_listener, 2, 2, "register CH ID"},
    {"unregister", command::verb::unregister_listener, 2, 2, "unregister CH ID"},
    {"registered", command::verb::registered, 2, 2, "registered CH ID"},
    {"list", command::verb::list, 0, 0, "list"},
    {"connections", command::verb::connections, 0, 0, "connections"},
    {"sleep", command::verb::sleep, 1, 1, "sleep MS"},
    {"wait-for", command::verb::wait_for, 2, 4, "wait-for CH ID [PID] [TIMEOUT_MS]"},
    {"wait-for-absent", command::verb::wait_for_absent, 2, 4,
     "wait-for-absent CH ID [PID] [TIMEOUT_MS]"},
    {"trust", command::verb::trust, 1, SIZE_MAX, "trust PID|PATH [LEVEL]"},
    {"echo", command::verb::echo, 0, SIZE_MAX, "echo [TEXT]"},
    {"help", command::verb::help, 0, 0, "help"},
    {"quit", command::verb::quit, 0, 0, "quit"},
};

std::string trim(const std::string& line) {
  std::size_t begin = 0;
  std::size_t end = line.size();
  while (begin < end && (line[begin] == ' ' || line[begin] == '\t')) ++begin;
  while (end > begin && (line[end - 1] == ' ' || line[end - 1] == '\t' || line[end - 1] == '\r' ||
                         line[end - 1] == '\n')) {
    --end;
  }
  return line.substr(begin, end - begin);
}

std::string ms_text(std::uint32_t ms) { return std::to_string(ms) + " ms"; }

std::string pid_text(const std::optional<std::uint32_t>& pid) {
  return pid ? " pid=" + std::to_string(*pid) : std::string();
}

}  // namespace

const char* commands_help() {
  return "  register CH ID        register listener ID on channel CH\n"
         "  unregister CH ID      remove one registration of (CH, ID)\n"
         "  registered CH ID      ask the bus whether any process has (CH, ID): yes or no\n"
         "  list                  the listener table learned from notifications, by pid\n"
         "  connections           the live connections learned from the gateway\n"
         "  sleep MS              pause for MS milliseconds\n"
         "  wait-for CH ID [PID] [TIMEOUT_MS]\n"
         "                        wait until process PID (any process when PID is left out\n"
         "                        or is \"any\"; \"self\" is this process) has (CH, ID) in the\n"
         "                        table; fails after TIMEOUT_MS (default 10000)\n"
         "  wait-for-absent CH ID [PID] [TIMEOUT_MS]\n"
         "                        the same, until no such listener is left\n"
         "  trust PID|PATH [LEVEL]\n"
         "                        how the gateway judges process PID (\"self\": this\n"
         "                        process) or the image file PATH against a pipe of\n"
         "                        LEVEL (0 or 1, default 0): ALLOW or DENY, its trust,\n"
         "                        the verification's result, both signers and the reason;\n"
         "                        the image is verified afresh (the trust cache is not\n"
         "                        used). PATH may hold blanks\n"
         "  echo [TEXT]           print TEXT (a marker for scripts and demos)\n"
         "  help                  this list\n"
         "  quit                  tear down and exit\n"
         "  Blank lines and lines starting with # are ignored. Words are separated by\n"
         "  blanks; names are UTF-8 and cannot contain blanks. MS and TIMEOUT_MS are at\n"
         "  most 86400000.\n";
}

parsed_line parse_command(const std::string& raw, std::uint32_t self_pid) {
  const std::string line = trim(raw);
  if (line.empty() || line[0] == '#') return no_command{};
  // Names reach the bus as zero-terminated strings; a NUL would cut one.
  if (line.find('\0') != std::string::npos) return bad_command{"a command cannot contain a NUL byte"};
  const std::vector<std::string> words = split_words(line);

  const verb_info* info = nullptr;
  for (const verb_info& v : verbs) {
    if (words[0] == v.word) info = &v;
  }
  if (info == nullptr) {
    return bad_command{"unknown command \"" + printable(words[0]) + "\" (try help)"};
  }
  const std::size_t args = words.size() - 1;
  if (args < info->min_args || args > info->max_args) {
    return bad_command{"usage: " + std::string(info->usage)};
  }

  command c;
  c.what = info->what;
  c.line = line;
  switch (c.what) {
    case command::verb::register_listener:
    case command::verb::unregister_listener:
    case command::verb::registered:
      c.channel = words[1];
      c.id = words[2];
      break;
    case command::verb::sleep: {
      const auto ms = parse_u32(words[1], max_wait_ms);
      if (!ms) {
        return bad_command{"sleep: MS must be a number of milliseconds from 0 to " +
                           std::to_string(max_wait_ms) + ", not \"" + printable(words[1]) + "\""};
      }
      c.ms = *ms;
      break;
    }
    case command::verb::wait_for:
    case command::verb::wait_for_absent: {
      c.channel = words[1];
      c.id = words[2];
      c.ms = default_wait_ms;
      std::size_t next = 3;
      // A lone number after the names is the PID; "any" and "self" keep
      // the PID slot so that a timeout can follow.
      if (args >= 3) {
        const std::string& word = words[next++];
        if (word == "self") {
          c.pid = self_pid;
        } else if (word != "any" && word != "*") {
          c.pid = parse_u32(word);
          if (!c.pid) {
            return bad_command{words[0] + ": PID must be a process id, \"any\" or \"self\", not \"" +
                               printable(word) + "\""};
          }
        }
      }
      if (args >= 4) {
        const auto ms = parse_u32(words[next], max_wait_ms);
        if (!ms) {
          return bad_command{words[0] + ": TIMEOUT_MS must be from 0 to " +
                             std::to_string(max_wait_ms) + ", not \"" + printable(words[next]) +
                             "\""};
        }
        c.ms = *ms;
      }
      break;
    }
    case command::verb::echo: {
      const std::size_t after = line.find_first_of(" \t");
      c.text = after == std::string::npos ? std::string() : trim(line.substr(after));
      break;
    }
    case command::verb::trust: {
      // The target is everything after the verb, but for a last word 0 or 1
      // after it: a path may hold blanks.
      std::string target = trim(line.substr(line.find_first_of(" \t")));
      if (args >= 2 && (words.back() == "0" || words.back() == "1")) {
        c.level = words.back() == "1" ? 1 : 0;
        target = trim(target.substr(0, target.size() - 1));
      } else if (args == 2 && parse_u32(words[1])) {
        return bad_command{"trust: LEVEL must be 0 or 1, not \"" + printable(words.back()) + "\""};
      }
      if (target == "self") {
        c.pid = self_pid;
      } else if (target.find_first_not_of("0123456789") == std::string::npos) {
        c.pid = parse_u32(target);
        if (!c.pid) return bad_command{"trust: PID must be a process id, not \"" + printable(target) + "\""};
      } else {
        c.text = target;
      }
      break;
    }
    default:
      break;
  }
  return c;
}

command_runner::outcome command_runner::explain(const command& c) {
  if (explainer_ == nullptr) {
    out_.error(c.line + (has_gateway_ ? ": the gateway explains nothing (an older vorbel.dll?)"
                                      : ": the bus has no gateway to explain its admission"));
    return outcome::failed;
  }
  // The explainer calls back once, on this thread, before it returns.
  struct receiver final : igateway_admission_observer {
    console& out;
    explicit receiver(console& to) : out(to) {}
    void* GetInterface(GUID iid) override {
      return qm::same_iid(iid, IID_igateway_admission_observer) ? this : nullptr;
    }
    void on_admission(const gateway_admission* a) override {
      if (a != nullptr) out.emit(admission_text("trust", *a), admission_object("trust", *a));
    }
  } printer(out_);
  const std::uint32_t err = c.pid ? explainer_->explain_process(*c.pid, c.level, &printer)
                                  : explainer_->explain_image(c.text.c_str(), c.level, &printer);
  if (err != 0) {
    out_.error(c.line + ": " + describe_error(err));
    return outcome::failed;
  }
  return outcome::ok;
}

command_runner::outcome command_runner::run(const command& c) {
  switch (c.what) {
    case command::verb::register_listener:
    case command::verb::unregister_listener: {
      const bool add = c.what == command::verb::register_listener;
      const std::uint32_t err = add ? bus_->register_listener(c.channel.c_str(), c.id.c_str())
                                    : bus_->unregister_listener(c.channel.c_str(), c.id.c_str());
      if (err != 0) {
        out_.error(c.line + ": " + describe_error(err));
        return outcome::failed;
      }
      return outcome::ok;
    }
    case command::verb::registered: {
      const bool yes = bus_->is_registered_listener(c.channel.c_str(), c.id.c_str());
      out_.emit("registered channel=" + printable(c.channel) + " id=" + printable(c.id) + ": " +
                    (yes ? "yes" : "no"),
                ordered_json{{"event", "registered"},
                             {"channel", c.channel},
                             {"id", c.id},
                             {"registered", yes}});
      return outcome::ok;
    }
    case command::verb::list:
      state_.print_listeners();
      return outcome::ok;
    case command::verb::connections:
      state_.print_connections(has_gateway_);
      return outcome::ok;
    case command::verb::sleep:
      std::this_thread::sleep_for(std::chrono::milliseconds(c.ms));
      return outcome::ok;
    case command::verb::wait_for:
    case command::verb::wait_for_absent: {
      const bool present = c.what == command::verb::wait_for;
      const char* word = present ? "wait-for" : "wait-for-absent";
      const auto result = state_.wait_listener(c.channel, c.id, c.pid, present,
                                               std::chrono::milliseconds(c.ms));
      if (!result) {
        out_.error(c.line + ": timed out after " + ms_text(c.ms) +
                   (present ? " (the listener did not appear)" : " (the listener is still there)"));
        return outcome::failed;
      }
      ordered_json object{{"event", word}, {"channel", c.channel}, {"id", c.id}};
      std::string text = std::string(word) + " channel=" + printable(c.channel) +
                         " id=" + printable(c.id);
      if (present) {
        object["pid"] = *result;
        text += ": found pid=" + std::to_string(*result);
      } else {
        if (c.pid) object["pid"] = *c.pid;
        text += pid_text(c.pid) + ": absent";
      }
      out_.emit(text, object);
      return outcome::ok;
    }
    case command::verb::trust:
      return explain(c);
    case command::verb::echo:
      out_.emit(c.text, ordered_json{{"event", "echo"}, {"text", c.text}});
      return outcome::ok;
    case command::verb::help: {
      const std::string text = std::string("commands:\n") + commands_help();
      out_.emit(text.substr(0, text.size() - 1), ordered_json{{"event", "help"}, {"text", text}});
      return outcome::ok;
    }
    case command::verb::quit:
      return outcome::quit;
  }
  return outcome::ok;
}

}  // namespace vorbel_host
