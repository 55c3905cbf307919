// The bus registry driven through doubles at its build seams.
#include <gtest/gtest.h>

#include <map>

#include "registry/vorbel_impl.h"
#include "support/config_provider.h"
#include "support/log_capture.h"

namespace {

using test_support::has_line;
using strings = std::vector<std::string>;

// The registry only hands faces back, never calls them: each double's own
// address serves as its face. Every call lands in `log`, in order (the
// registry makes them under its lock).
struct fake_bus final : owned_bus {
  fake_bus(std::string n, strings& l) : name(std::move(n)), log(l) {}
  ~fake_bus() override { log.push_back("~bus " + name); }
  ibus* face() override { return reinterpret_cast<ibus*>(this); }
  void unsubscribe() override { log.push_back("unsubscribe " + name); }
  std::string name;
  strings& log;
};

struct fake_gateway final : owned_gateway {
  fake_gateway(std::string n, std::uint32_t result, strings& l) : name(std::move(n)), start_result(result), log(l) {}
  ~fake_gateway() override { log.push_back("~gateway " + name); }
  igateway* face() override { return reinterpret_cast<igateway*>(this); }
  std::uint32_t start() override { return log.push_back("start " + name), start_result; }
  std::uint32_t stop() override { return log.push_back("stop " + name), 0; }
  std::string name;
  std::uint32_t start_result;
  strings& log;
};

// Per bus name: no bus (-1), a bus without gateway (absent), or a bus whose
// gateway's start returns the value.
struct fake_builder final : bus_builder {
  fake_builder(std::map<std::string, int>& p, strings& l) : plans(p), log(l) {}
  std::unique_ptr<owned_bus> build_bus(const char* name, ibus_configuration*) override {
    log.push_back(std::string("build_bus ") + name);
    return plans.count(name) && plans[name] < 0 ? nullptr : std::make_unique<fake_bus>(name, log);
  }
  std::unique_ptr<owned_gateway> build_gateway(owned_bus& bus, ibus_configuration*) override {
    const std::string& name = static_cast<fake_bus&>(bus).name;
    log.push_back("build_gateway " + name);
    if (!plans.count(name)) return nullptr;
    return std::make_unique<fake_gateway>(name, static_cast<std::uint32_t>(plans[name]), log);
  }
  std::map<std::string, int>& plans;
  strings& log;
};

class registry : public ::testing::Test {
 protected:
  void SetUp() override { test_support::clear_log(); }
  std::unique_ptr<vorbel_impl> make() { return std::make_unique<vorbel_impl>(std::make_unique<fake_builder>(plans, log)); }
  strings take() { return std::exchange(log, {}); }
  int default_calls() { return provider.default_asked; }
  std::map<std::string, int> plans;
  strings log;
  test_support::config_provider provider;
};

TEST_F(registry, one_bus_per_name_counted_and_a_leaked_one_torn_down_in_order) {
  plans["main"] = 0;
  auto r = make();
  ibus* first = r->create_bus("main", &provider);
  ASSERT_NE(nullptr, first);
  EXPECT_EQ(first, r->create_bus("main", nullptr)) << "an existing bus needs no provider";
  EXPECT_EQ(1, default_calls());
  r->destroy_bus("main");
  r->destroy_bus("missing");
  EXPECT_TRUE(has_line(L"vorbel_impl::destroy_bus", L"bud not found"));
  EXPECT_EQ((strings{"build_bus main", "build_gateway main", "start main"}), take()) << "a destroy counts down";
  r.reset();
  EXPECT_TRUE(has_line(L"vorbel_impl::~vorbel_impl", L"Leaked buses:"));
  EXPECT_TRUE(has_line(L"vorbel_impl::~vorbel_impl", L"leak bus name: main"));
  EXPECT_EQ((strings{"stop main", "unsubscribe main", "~gateway main", "~bus main"}), take());
}

TEST_F(registry, null_names_are_refused_before_anything_else) {
  auto r = make();
  EXPECT_EQ(nullptr, r->create_bus(nullptr, &provider));
  r->destroy_bus(nullptr);
  EXPECT_TRUE(take().empty());
  EXPECT_EQ(0, default_calls());
  EXPECT_TRUE(has_line(L"vorbel_impl::create_bus", L"bus name is nullptr"));
  EXPECT_TRUE(has_line(L"vorbel_impl::destroy_bus", L"bus name is nullptr"));
}

TEST_F(registry, the_first_default_bus_holds_the_mark_until_it_goes) {
  auto r = make();
  test_support::config_provider as_default;
  as_default.is_default = true;
  r->create_bus("a", &provider);
  EXPECT_EQ(nullptr, r->get_bus(nullptr)) << "a non-default bus is not the default";
  ibus* b = r->create_bus("b", &as_default);
  r->create_bus("c", &as_default);
  EXPECT_EQ(b, r->get_bus(nullptr));
  r->destroy_bus("b");
  EXPECT_EQ(nullptr, r->get_bus(nullptr)) << "c was not default when it was inserted";
  ibus* d = r->create_bus("d", &as_default);
  EXPECT_EQ(d, r->get_bus(nullptr));
}

TEST_F(registry, a_failed_gateway_start_keeps_the_bus_and_a_failed_build_keeps_nothing) {
  plans["g"] = 5;
  plans["bad"] = -1;
  auto r = make();
  provider.is_default = true;
  ibus* bus = r->create_bus("g", &provider);
  ASSERT_NE(nullptr, bus);
  EXPECT_EQ(nullptr, r->get_gateway("g"));
  EXPECT_EQ(bus, r->get_bus(nullptr));
  EXPECT_EQ((strings{"build_bus g", "build_gateway g", "start g", "~gateway g"}), take())
      << "a gateway that never started is destroyed without a stop";
  r->destroy_bus("g");
  EXPECT_EQ((strings{"unsubscribe g", "~bus g"}), take());
  EXPECT_EQ(nullptr, r->create_bus("bad", &provider));
  EXPECT_EQ((strings{"build_bus bad"}), take());
  EXPECT_EQ(1, default_calls()) << "not asked after the failed build";
  EXPECT_EQ(nullptr, r->get_bus(nullptr));
}

}  // namespace
