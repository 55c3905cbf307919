// Admission decisions as a host and an operator see them, in real
// processes: the admission observer of this process's gateway when peers
// connect to it and when it joins them, and vorbel_host's admission events
// and `trust` command, for a peer of our signer, of another signer, an
// unsigned one and a tampered one. Each must tell the decision actually
// taken, with its verification code and both signers.
#include <gtest/gtest.h>

#include <string>

#include "e2e/host_process.h"
#include "security/signature.h"
#include "support/admission_recorder.h"

namespace {

using namespace e2e;
using namespace test_support;

const std::string level0 = "\\\\.\\pipe\\vorbel_adm_level0";
const std::string level1 = "\\\\.\\pipe\\vorbel_adm_level1";

enum class signer_of { us, other, nobody };

// One kind of peer: what its image's verification returns, who signed it,
// its trust, and whether a pipe of level 0 and one of level 1 admit it.
struct peer_row {
  const char* image;
  const char* verification;
  signer_of signer;
  gateway_admission_trust trust;
  bool level0, level1;
  gateway_admission_reason refused_for;
};
const peer_row rows[] = {
    {"host_a", "ERROR_SUCCESS", signer_of::us, gateway_admission_trust::high_trust, true, true,
     gateway_admission_reason::admitted},
    {"host_b", "ERROR_SUCCESS", signer_of::other, gateway_admission_trust::low_trust, false, true,
     gateway_admission_reason::other_signer},
    {"host_unsigned", "TRUST_E_NOSIGNATURE", signer_of::nobody, gateway_admission_trust::untrusted, false, false,
     gateway_admission_reason::signature_invalid},
    {"host_tampered", "TRUST_E_BAD_DIGEST", signer_of::nobody, gateway_admission_trust::untrusted, false, false,
     gateway_admission_reason::signature_invalid},
};

std::string our_signer() {
  const auto current = get_current_signature();
  return current ? std::string(current->subject.begin(), current->subject.end()) : std::string();
}
std::string name_of(signer_of who) {
  return who == signer_of::us ? our_signer() : who == signer_of::other ? VORBEL_SIGNER_B_SUBJECT : "";
}
std::string image_of(const peer_row& row) { return "..\\e2e_hosts\\" + std::string(row.image) + ".exe"; }
std::string full_path(const std::string& relative) {
  char full[MAX_PATH];
  return std::string(full, ::GetFullPathNameA(relative.c_str(), MAX_PATH, full, nullptr));
}
std::wstring deny(DWORD pid) { return L"DENY pid=" + std::to_wstring(pid) + L" reason: check process security failed"; }

// The facts of one heard decision against the row, for a pipe of `level`.
::testing::AssertionResult facts_match(const heard& h, const peer_row& row, std::uint32_t level) {
  const bool allowed = level == 0 ? row.level0 : row.level1;
  const auto reason = allowed ? gateway_admission_reason::admitted : row.refused_for;
  const std::string image = full_path(image_of(row));
  if (h.allowed == allowed && h.level == level && h.trust == row.trust && h.verification_name == row.verification &&
      (h.verification == 0) == (std::string(row.verification) == "ERROR_SUCCESS") &&
      h.signer == name_of(row.signer) && h.own_signer == our_signer() && h.reason == reason &&
      _stricmp(h.image.c_str(), image.c_str()) == 0 && !h.reason_text.empty()) {
    return ::testing::AssertionSuccess();
  }
  return ::testing::AssertionFailure()
         << "heard " << (h.allowed ? "ALLOW" : "DENY") << " level=" << h.level << " trust=" << trust_name(h.trust)
         << " verification=" << h.verification_name << " (" << h.verification << ") signer=\"" << h.signer
         << "\" own_signer=\"" << h.own_signer << "\" reason=" << static_cast<int>(h.reason) << " \""
         << h.reason_text << "\" image=" << h.image << "; expected " << (allowed ? "ALLOW" : "DENY")
         << " trust=" << trust_name(row.trust) << " verification=" << row.verification << " signer=\""
         << name_of(row.signer) << "\" image=" << image;
}

// Where `kind` about `pid` first comes in the order the worker delivered.
std::size_t first_index(const std::vector<heard>& all, const std::string& kind, std::uint32_t pid) {
  for (std::size_t i = 0; i < all.size(); ++i) {
    if (all[i].kind == kind && all[i].pid == pid) return i;
  }
  return all.size();
}

class admission_test : public ::testing::Test {
 protected:
  void SetUp() override { clear_log(); }
};

// Peers connect to two pipes of this process, of levels 0 and 1: every
// decision reaches the admission observer with the facts it was taken on,
// before the connection's own notification; a refused peer's retry is
// answered from the cache with the same facts.
TEST_F(admission_test, each_decision_on_a_client_reaches_the_observer_with_its_facts) {
  this_process us({{level0, 0}, {level1, 1}}, {}, "server");
  ASSERT_TRUE(us.up()) << dump_log();
  admission_recorder heard_here;
  ASSERT_TRUE(us.gateway_face().add_observer(&heard_here, 0));
  for (const peer_row& row : rows) {
    SCOPED_TRACE(row.image);
    // At import level 1 the peer takes us as its server whoever signed it.
    auto peer = start_host(row.image, std::string("client_") + row.image, host_config({level0, level1}, {}, 1));
    ASSERT_TRUE(peer->ready()) << peer->output();
    for (const std::uint32_t level : {0u, 1u}) {
      const std::string pipe = level == 0 ? "\\vorbel_adm_level0" : "\\vorbel_adm_level1";
      const bool allowed = level == 0 ? row.level0 : row.level1;
      // A refused client comes back, and is answered from the cache.
      ASSERT_TRUE(heard_here.wait_about("admission", peer->pid(), pipe, allowed ? 1 : 2, patience))
          << "decisions about pid " << peer->pid() << " on " << pipe << "\n" << dump_log();
      const auto decisions = heard_here.about("admission", peer->pid(), pipe);
      EXPECT_EQ(gateway_admission_side::local, decisions[0].side);
      EXPECT_TRUE(facts_match(decisions[0], row, level)) << pipe;
      if (allowed) {
        EXPECT_TRUE(heard_here.wait_about("connect", peer->pid(), pipe, 1, patience)) << "the admitted connection";
      } else {
        // The retry comes once the first refusal was cached (the two pipes'
        // first decisions may both be judged: they run at once).
        EXPECT_EQ(gateway_admission_source::cached_process, decisions[1].source);
        EXPECT_TRUE(facts_match(decisions[1], row, level)) << pipe << ", from the cache";
        EXPECT_TRUE(heard_here.about("connect", peer->pid(), pipe).empty()) << "a refused connection is not notified";
        EXPECT_FALSE(find_lines(L"gateway_observer::is_allowed", deny(peer->pid())).empty());
      }
      // The component's own line says the same.
      EXPECT_TRUE(has_line(L"gateway_observer::admission",
                           std::wstring(allowed ? L"ALLOW" : L"DENY") + L" side=local pid=" +
                               std::to_wstring(peer->pid()) + L" pipe=" + std::wstring(pipe.begin(), pipe.end()) +
                               L" level=" + std::to_wstring(level) + L" "));
    }
    if (row.level1) {
      const auto all = heard_here.seen();
      EXPECT_LT(first_index(all, "admission", peer->pid()), first_index(all, "connect", peer->pid()))
          << "the decision is heard before the connection it admitted";
    }
  }
}

// This process joins a pipe that each kind of peer serves, at import level
// 0: the client side's decisions reach the observer too.
TEST_F(admission_test, each_decision_on_a_server_reaches_the_observer_with_its_facts) {
  for (const peer_row& row : rows) {
    SCOPED_TRACE(row.image);
    clear_log();
    const std::string pipe = std::string("\\\\.\\pipe\\vorbel_adm_server_") + row.image;
    // The client first, so that its observer hears the first decision: it
    // retries until somebody serves the pipe.
    this_process us({}, {pipe}, "client", 0);
    ASSERT_TRUE(us.up()) << dump_log();
    admission_recorder heard_here;
    ASSERT_TRUE(us.gateway_face().add_observer(&heard_here, 0));
    auto server = start_host(row.image, std::string("server_") + row.image, host_config({}, {{pipe, 1}}));
    ASSERT_TRUE(server->ready()) << server->output();
    const std::string name = pipe.substr(8);  // as read from the handle
    ASSERT_TRUE(heard_here.wait_about("admission", server->pid(), name, row.level0 ? 1 : 2, patience)) << dump_log();
    const auto decisions = heard_here.about("admission", server->pid(), name);
    EXPECT_EQ(gateway_admission_side::remote, decisions[0].side);
    EXPECT_TRUE(facts_match(decisions[0], row, 0));
    if (row.level0) {
      EXPECT_TRUE(heard_here.wait_about("connect", server->pid(), name, 1, patience)) << "the server joined";
    } else {
      EXPECT_EQ(gateway_admission_source::cached_process, decisions[1].source);
      EXPECT_TRUE(facts_match(decisions[1], row, 0)) << "the retry, from the cache";
      EXPECT_TRUE(has_line(L"parlo_ipc::pipe_client::run",
                           L"the sink turned down server pid=" + std::to_wstring(server->pid())));
      EXPECT_TRUE(heard_here.about("connect", server->pid()).empty());
    }
    us.gateway_face().remove_observer(&heard_here, 0);
  }
}

// The part of a vorbel_host decision line that an explanation must repeat:
// from " trust=" up to " source=" (trust, verification, signers, image).
std::string judged_part(const std::string& line) {
  const std::size_t from = line.find(" trust=");
  const std::size_t to = line.find(" source=");
  return from == std::string::npos || to == std::string::npos ? "(no facts in: " + line + ")"
                                                             : line.substr(from, to - from);
}

// Sends `command` to `host` and returns the first line it printed after it
// that begins with the command's own first word; empty when none came.
std::string answer(host_process& host, const std::string& command) {
  static int next = 0;
  const std::string marker = "answer-" + std::to_string(++next);
  host.send("echo " + marker);
  host.send(command);
  const std::string word = command.substr(0, command.find(' ')) + " ";
  std::string line;
  wait_until([&] {
    const std::string text = host.output();
    const std::size_t after = text.find("\n" + marker + "\n");
    const std::size_t at = after == std::string::npos ? after : text.find("\n" + word, after);
    const std::size_t end = at == std::string::npos ? at : text.find('\n', at + 1);
    if (end != std::string::npos) line = text.substr(at + 1, end - at - 1);
    return end != std::string::npos;
  }, patience);
  return line;
}

// An operator's view: a vorbel_host serving a level 0 pipe prints each
// decision as it is taken, and `trust PID` and `trust PATH` print the same
// judgement; its log shows the decision actually taken.
TEST_F(admission_test, vorbel_host_prints_each_decision_and_explains_it_alike) {
  const std::string pipe = "\\\\.\\pipe\\vorbel_adm_host";
  auto judge = start_host("host_a", "judge", host_config({}, {{pipe, 0}}));
  ASSERT_TRUE(judge->ready()) << judge->output();
  for (const peer_row& row : rows) {
    SCOPED_TRACE(row.image);
    auto peer = start_host(row.image, std::string("judged_") + row.image, host_config({pipe}, {}, 1));
    ASSERT_TRUE(peer->ready()) << peer->output();
    const std::string verdict = row.level0 ? "ALLOW" : "DENY";
    const std::string pid = std::to_string(peer->pid());
    const std::string heard_line =
        judge->wait_line("admission local " + verdict + " pid=" + pid + " pipe=\\vorbel_adm_host level=0 ");
    ASSERT_FALSE(heard_line.empty()) << judge->output();
    const std::string facts = judged_part(heard_line);
    for (const std::string& part :
         {" trust=" + std::string(trust_name(row.trust)) + " ", " verification=" + std::string(row.verification),
          " signer=\"" + name_of(row.signer) + "\" ", " own_signer=\"" + our_signer() + "\" "}) {
      EXPECT_NE(std::string::npos, facts.find(part)) << part << " in " << heard_line;
    }
    EXPECT_NE(std::string::npos, heard_line.find(" source=judged ")) << heard_line;

    const std::string by_pid = answer(*judge, "trust " + pid + " 0");
    EXPECT_EQ(0u, by_pid.rfind("trust " + verdict + " pid=" + pid + " level=0 ", 0)) << by_pid;
    EXPECT_EQ(facts, judged_part(by_pid)) << judge->output();
    EXPECT_NE(std::string::npos, by_pid.find(" source=judged ")) << "not from the cache: " << by_pid;
    const std::string by_path = answer(*judge, "trust " + full_path(image_of(row)) + " 0");
    EXPECT_EQ(0u, by_path.rfind("trust " + verdict + " pid=0 level=0 ", 0)) << by_path;
    EXPECT_EQ(facts, judged_part(by_path)) << judge->output();

    // The decision actually taken.
    if (row.level0) {
      EXPECT_TRUE(judge->wait_for("connect local pipe=\\vorbel_adm_host pid=" + pid));
    } else {
      const std::string refusal = "DENY pid=" + pid + " reason: check process security failed";
      EXPECT_TRUE(wait_until([&] { return read_file("judge.log").find(refusal) != std::string::npos; }, patience))
          << refusal;
      EXPECT_EQ(std::string::npos, judge->output().find("connect local pipe=\\vorbel_adm_host pid=" + pid + "\n"));
    }
  }
}

// The explainer refuses what it cannot judge: nothing is called, 87, a line.
TEST_F(admission_test, the_explainer_refuses_bad_arguments_without_calling_back) {
  this_process us({{level0, 0}}, {}, "server");
  ASSERT_TRUE(us.up()) << dump_log();
  auto* explainer = static_cast<igateway_trust_explainer*>(us.gateway_face().GetInterface(IID_igateway_trust_explainer));
  ASSERT_NE(nullptr, explainer);
  admission_recorder receiver;
  const std::uint32_t self = own();
  // What is asked: by pid (path null) or by path; level; with a receiver?
  const struct {
    const char* path;
    std::uint32_t level;
    bool with_receiver;
  } cases[] = {
      {nullptr, 2, true}, {nullptr, 0, false}, {"", 0, true}, {"C:\\a\xff\xfe.exe", 0, true},
      {"C:\\a.exe", 0xFFFFFFFF, true}, {"C:\\a.exe", 1, false},
  };
  for (const auto& c : cases) {
    admission_recorder* to = c.with_receiver ? &receiver : nullptr;
    const std::uint32_t result = c.path == nullptr ? explainer->explain_process(self, c.level, to)
                                                   : explainer->explain_image(c.path, c.level, to);
    EXPECT_EQ(87u, result) << (c.path ? c.path : "(pid)") << " level " << c.level;
  }
  EXPECT_TRUE(receiver.seen().empty());
  EXPECT_EQ(std::size(cases), find_lines(L"gateway::explain_process", L"refused: ").size() +
                                  find_lines(L"gateway::explain_image", L"refused: ").size());
  // And answers once, on the calling thread, when asked properly.
  ASSERT_EQ(0u, explainer->explain_process(self, 0, &receiver));
  ASSERT_EQ(1u, receiver.seen().size());
  EXPECT_EQ(::GetCurrentThreadId(), receiver.seen()[0].thread);
  EXPECT_EQ(gateway_admission_side::explanation, receiver.seen()[0].side);
  EXPECT_TRUE(receiver.seen()[0].allowed) << receiver.seen()[0].reason_text;
}

}  // namespace
