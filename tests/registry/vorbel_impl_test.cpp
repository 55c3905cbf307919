// The bus registry driven through doubles at its build seam.
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <map>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "registry/vorbel_impl.h"
#include "support/config_provider.h"
#include "support/log_capture.h"

namespace {

using test_support::has_line;

// What happened to the doubles, in order.
struct journal {
  std::mutex mutex;
  std::vector<std::string> events;
  void add(const std::string& e) {
    std::lock_guard<std::mutex> lock(mutex);
    events.push_back(e);
  }
  std::vector<std::string> take() {
    std::lock_guard<std::mutex> lock(mutex);
    return std::exchange(events, {});
  }
};

class fake_bus final : public ibus, public owned_bus {
 public:
  fake_bus(std::string name, journal& j) : name_(std::move(name)), journal_(j) {}
  ~fake_bus() override { journal_.add("~bus " + name_); }
  ibus* face() override { return this; }
  void unsubscribe() override { journal_.add("unsubscribe " + name_); }
  void* GetInterface(GUID) override { return nullptr; }
  void* get_messaging_bus() override { return nullptr; }
  std::uint32_t register_listener(const char*, const char*) override { return 0; }
  std::uint32_t unregister_listener(const char*, const char*) override { return 0; }
  bool is_registered_listener(const char*, const char*) override { return false; }
  bool add_observer(ibus_observer_base*, std::uintptr_t) override { return false; }
  bool remove_observer(ibus_observer_base*, std::uintptr_t) override { return false; }

 private:
  std::string name_;
  journal& journal_;
};

class fake_gateway final : public igateway, public owned_gateway {
 public:
  fake_gateway(std::string name, std::uint32_t start_result, journal& j)
      : name_(std::move(name)), start_result_(start_result), journal_(j) {}
  ~fake_gateway() override { journal_.add("~gateway " + name_); }
  igateway* face() override { return this; }
  std::uint32_t start() override {
    journal_.add("start " + name_);
    return start_result_;
  }
  std::uint32_t stop() override {
    journal_.add("stop " + name_);
    return 0;
  }
  void* GetInterface(GUID) override { return nullptr; }
  bool add_observer(igateway_observer_base*, std::uintptr_t) override { return false; }
  bool remove_observer(igateway_observer_base*, std::uintptr_t) override { return false; }

 private:
  std::string name_;
  std::uint32_t start_result_;
  journal& journal_;
};

// How the double builds a bus of a given name.
struct plan {
  bool bus = true;
  bool gateway = false;
  std::uint32_t start_result = 0;
};

class fake_builder final : public bus_builder {
 public:
  fake_builder(std::map<std::string, plan>& plans, journal& j) : plans_(plans), journal_(j) {}
  std::unique_ptr<owned_bus> build_bus(const char* name, ibus_configuration*) override {
    journal_.add(std::string("build_bus ") + name);
    if (!plans_[name].bus) return nullptr;
    last_name_ = name;
    return std::make_unique<fake_bus>(name, journal_);
  }
  std::unique_ptr<owned_gateway> build_gateway(owned_bus&, ibus_configuration*) override {
    journal_.add("build_gateway " + last_name_);
    const plan& p = plans_[last_name_];
    if (!p.gateway) return nullptr;
    return std::make_unique<fake_gateway>(last_name_, p.start_result, journal_);
  }

 private:
  std::map<std::string, plan>& plans_;
  journal& journal_;
  std::string last_name_;
};

// Counts how often the registry asked a provider whether its bus is the default.
std::size_t default_calls(test_support::config_provider& provider) {
  return provider.calls_of("is_default_bus").size();
}

class registry : public ::testing::Test {
 protected:
  void SetUp() override { test_support::clear_log(); }
  std::unique_ptr<vorbel_impl> make() {
    return std::make_unique<vorbel_impl>(std::make_unique<fake_builder>(plans, events));
  }
  std::map<std::string, plan> plans;
  journal events;
};

using strings = std::vector<std::string>;

TEST_F(registry, answers_its_two_identifiers_and_warns_about_others) {
  auto r = make();
  EXPECT_EQ(static_cast<ivorbel*>(r.get()), r->GetInterface(IID_IQmBaseInterface));
  EXPECT_EQ(static_cast<ivorbel*>(r.get()), r->GetInterface(IID_ivorbel));
  EXPECT_EQ(nullptr, r->GetInterface(IID_IQmCreateAlternate));
  // 0x983304D0414E2323 + 0xE952825D7C884176 modulo 2^64.
  const auto lines = test_support::find_lines(L"vorbel_impl::GetInterface", L"unknown interface ");
  ASSERT_EQ(1u, lines.size());
  EXPECT_EQ(L"unknown interface 9333014433323443353", lines[0].text);
  EXPECT_EQ(8u, lines[0].level);
}

TEST_F(registry, one_bus_per_name_counted_and_torn_down_by_the_last_destroy) {
  plans["main"] = {true, true, 0};
  auto r = make();
  test_support::config_provider provider;
  ibus* first = r->create_bus("main", &provider);
  ASSERT_NE(nullptr, first);
  EXPECT_EQ(first, r->create_bus("main", nullptr)) << "an existing bus needs no provider";
  EXPECT_EQ(1u, default_calls(provider)) << "the provider is consulted by the first call only";
  EXPECT_EQ((strings{"build_bus main", "build_gateway main", "start main"}), events.take());
  EXPECT_NE(nullptr, r->get_gateway("main"));

  r->destroy_bus("main");
  EXPECT_TRUE(events.take().empty()) << "the first destroy only counts down";
  r->destroy_bus("missing");
  EXPECT_TRUE(events.take().empty()) << "an unknown name changes nothing";
  const auto missing = test_support::find_lines(L"vorbel_impl::destroy_bus", L"bud not found");
  ASSERT_EQ(1u, missing.size());
  EXPECT_EQ(8u, missing[0].level);
  EXPECT_EQ(first, r->get_bus("main"));

  r->destroy_bus("main");
  EXPECT_EQ((strings{"stop main", "unsubscribe main", "~gateway main", "~bus main"}), events.take());
  EXPECT_EQ(nullptr, r->get_bus("main"));

  const auto trace = test_support::find_lines(L"vorbel_impl::destroy_bus", L"vorbel_impl::destroy_bus()");
  ASSERT_EQ(6u, trace.size()) << "three destroys, each traced in and out";
  EXPECT_EQ(L"-> vorbel_impl::destroy_bus()", trace[0].text);
  EXPECT_EQ(1, trace[0].depth);
  EXPECT_EQ(32u, trace[0].level);
  EXPECT_TRUE(has_line(L"vorbel_impl::create_bus", L"bus name: main"));
}

TEST_F(registry, null_names_are_refused_before_anything_else) {
  auto r = make();
  test_support::config_provider provider;
  EXPECT_EQ(nullptr, r->create_bus(nullptr, &provider));
  r->destroy_bus(nullptr);
  EXPECT_TRUE(events.take().empty());
  EXPECT_EQ(0u, default_calls(provider));
  EXPECT_TRUE(has_line(L"vorbel_impl::create_bus", L"bus name is nullptr"));
  EXPECT_TRUE(has_line(L"vorbel_impl::destroy_bus", L"bus name is nullptr"));
  EXPECT_EQ(nullptr, r->create_bus("new", nullptr)) << "a new bus cannot be built without a provider";
}

TEST_F(registry, the_first_default_bus_holds_the_mark_until_it_goes) {
  auto r = make();
  test_support::config_provider plain, as_default;
  as_default.is_default = true;
  EXPECT_EQ(nullptr, r->get_bus(nullptr));
  ibus* a = r->create_bus("a", &plain);
  EXPECT_EQ(nullptr, r->get_bus(nullptr)) << "a non-default bus is not the default";
  ibus* b = r->create_bus("b", &as_default);
  ibus* c = r->create_bus("c", &as_default);
  EXPECT_EQ(b, r->get_bus(nullptr));
  EXPECT_NE(a, b);

  r->destroy_bus("b");
  EXPECT_EQ(nullptr, r->get_bus(nullptr)) << "c was not default when it was inserted";
  EXPECT_EQ(nullptr, r->get_gateway(nullptr));
  EXPECT_EQ(c, r->get_bus("c"));
  ibus* d = r->create_bus("d", &as_default);
  EXPECT_EQ(d, r->get_bus(nullptr));
  r->destroy_bus("a");
  r->destroy_bus("c");
  r->destroy_bus("d");
}

TEST_F(registry, a_gateway_that_fails_to_start_is_dropped_but_the_bus_stays) {
  plans["g"] = {true, true, 5};
  auto r = make();
  test_support::config_provider provider;
  provider.is_default = true;
  ibus* bus = r->create_bus("g", &provider);
  ASSERT_NE(nullptr, bus);
  EXPECT_EQ(nullptr, r->get_gateway("g"));
  EXPECT_EQ(bus, r->get_bus(nullptr));
  EXPECT_EQ((strings{"build_bus g", "build_gateway g", "start g", "~gateway g"}), events.take())
      << "a gateway that never started is destroyed without a stop";
  r->destroy_bus("g");
  EXPECT_EQ((strings{"unsubscribe g", "~bus g"}), events.take());
}

TEST_F(registry, a_failed_build_registers_nothing_and_asks_nothing_more) {
  plans["bad"] = {false, true, 0};
  auto r = make();
  test_support::config_provider provider;
  provider.is_default = true;
  EXPECT_EQ(nullptr, r->create_bus("bad", &provider));
  EXPECT_EQ((strings{"build_bus bad"}), events.take());
  EXPECT_EQ(0u, default_calls(provider));
  EXPECT_EQ(nullptr, r->get_bus("bad"));
  EXPECT_EQ(nullptr, r->get_bus(nullptr));
}

TEST_F(registry, destruction_reports_and_tears_down_leaked_buses) {
  plans["with_gateway"] = {true, true, 0};
  plans["plain"] = {true, false, 0};
  auto r = make();
  test_support::config_provider provider;
  r->create_bus("with_gateway", &provider);
  r->create_bus("plain", &provider);
  r->create_bus("plain", &provider);
  events.take();
  test_support::clear_log();
  r.reset();

  const auto lines = test_support::find_lines(L"vorbel_impl::~vorbel_impl", L"");
  ASSERT_EQ(3u, lines.size()) << test_support::dump_log();
  EXPECT_EQ(L"Leaked buses:", lines[0].text);
  std::vector<std::wstring> leaked = {lines[1].text, lines[2].text};
  std::sort(leaked.begin(), leaked.end());
  EXPECT_EQ((std::vector<std::wstring>{L"leak bus name: plain", L"leak bus name: with_gateway"}), leaked);
  for (const auto& line : lines) EXPECT_EQ(8u, line.level);

  const auto happened = events.take();
  std::vector<std::string> with_gateway, plain;
  for (const auto& e : happened) {
    if (e.find("with_gateway") != std::string::npos) with_gateway.push_back(e);
    if (e.find("plain") != std::string::npos) plain.push_back(e);
  }
  EXPECT_EQ((strings{"stop with_gateway", "unsubscribe with_gateway", "~gateway with_gateway",
                     "~bus with_gateway"}),
            with_gateway);
  EXPECT_EQ((strings{"~bus plain"}), plain);
}

TEST_F(registry, concurrent_creates_and_destroys_keep_one_bus_and_an_exact_count) {
  auto r = make();
  test_support::config_provider provider;
  constexpr int threads = 8;
  constexpr int rounds = 200;
  std::vector<std::thread> workers;
  std::atomic<int> mismatches{0};
  ibus* anchor = r->create_bus("shared", &provider);  // keeps the bus alive throughout
  for (int t = 0; t < threads; ++t) {
    workers.emplace_back([&] {
      for (int i = 0; i < rounds; ++i) {
        if (r->create_bus("shared", &provider) != anchor) ++mismatches;
        r->destroy_bus("shared");
      }
    });
  }
  for (auto& w : workers) w.join();
  EXPECT_EQ(0, mismatches.load());
  EXPECT_EQ((strings{"build_bus shared", "build_gateway shared"}), events.take());
  r->destroy_bus("shared");
  EXPECT_EQ((strings{"unsubscribe shared", "~bus shared"}), events.take());
  EXPECT_EQ(nullptr, r->get_bus("shared"));
}

}  // namespace
