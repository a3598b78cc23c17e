// Every allocation of a change fails once, in the handler of the real plug-in and in the server
// around it: a change that is reported as made is in the file, whole, and one that is not is not.
#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <memory>
#include <string>

#include "../slapi/failing_allocation.h"
#include "../temporary_directory.h"
#include "cfg/object_class_table.h"
#include "cfg/session.h"
#include "core_bare_session.h"
#include "plugin/loader.h"

namespace orv::server::test {
namespace {

using orv::test::AllocationFault;

constexpr const char* kBox = "cn=box,cn=schemas,cn=configuration";
constexpr const char* kFile =
    "dn: CN=CONFIGURATION\n"
    "objectClass: top\nobjectClass: orv-slapdConfigEntry\nobjectClass: orv-slapdTop\n"
    "cn: Configuration\norv-slapdAdminDN: cn=root\norv-slapdAdminPW: secret\n\n"
    "dn: CN=ADMINGROUP,CN=CONFIGURATION\nobjectClass: top\nobjectClass: container\n"
    "cn: AdminGroup\n\n"
    "dn: CN=SCHEMAS,CN=CONFIGURATION\nobjectClass: top\nobjectClass: container\ncn: Schemas\n\n"
    "dn: cn=old,CN=SCHEMAS,CN=CONFIGURATION\nobjectClass: top\nobjectClass: container\n"
    "cn: old\ndescription: one\n";

// The plug-in, started once: what it keeps refers to this until the process ends.
class StartedBackend {
 public:
  static StartedBackend& instance() {
    static auto* const started = new StartedBackend;
    return *started;
  }

  std::string error;
  std::string config;
  Backend backend;

 private:
  StartedBackend() {
    std::string pattern = testing::TempDir() + "/orv-backend-XXXXXX";
    if (mkdtemp(pattern.data()) == nullptr) error = "no folder";
    config = pattern + "/config.ldif";
    std::ofstream(config) << kFile;
    backend.suffixes = suffixes_;
    backend.handlers = slapi_pblock_new();
    PluginError failure;
    LoadedPlugin plugin = load_plugin(ORV_PLUGIN, "config_backend_init", backend.handlers, failure);
    if (!plugin) error = failure.text;
    if (!plugin) return;
    plugin.release();
    auto* const startup = static_cast<BackendStartup*>(std::calloc(1, sizeof(BackendStartup)));
    startup->config_file = config.c_str();
    backend.private_data = startup;
    if (slapi_pblock_instance_start(backend.handlers)(&backend) != 0) error = "no start";
  }
  const char* suffixes_[2] = {"CN=CONFIGURATION", nullptr};
};

class Home final : public OperationHome {
 public:
  explicit Home(OutputMeter& meter) : output_(meter) {
    connection_.aux = &aux_;
    connection_.authority = 0x0C;
    install_senders(connection_);
  }
  Connection& connection() noexcept override { return connection_; }
  void decided(std::shared_ptr<PendingOperation>, Verdict) noexcept override {}
  bool lost_interest(PendingOperation&) noexcept override { return false; }
  OutputShare& output() noexcept override { return output_; }
  FailedChanges& failed_changes() noexcept override { return failed_changes_; }

 private:
  Connection connection_;
  ConnectionAux aux_;
  OutputShare output_;
  FailedChanges failed_changes_;
};

class MemoryOfTheBackend : public testing::Test {
 protected:
  static void SetUpTestSuite() {
    ASSERT_EQ(cfg::register_attribute_types(builtin_schema().attribute_table()), 0);
    ASSERT_EQ(cfg::register_object_classes(builtin_schema().object_class_table()), 0);
    ASSERT_EQ(StartedBackend::instance().error, "");
  }
  MemoryOfTheBackend()
      : services{builtin_schema(), host, authenticator, {}, logs, {}, changes, verifiers, {}} {
    Settings settings;
    settings.error_log_level = "off";
    logs.open(settings);
    services.changes_made = cfg_changes_made;
  }
  ~MemoryOfTheBackend() override {
    changes.join();
    verifiers.join();
  }

  static std::string content() { return orv::test::content_of(StartedBackend::instance().config); }
  static void put_back() {
    const std::string& config = StartedBackend::instance().config;
    std::ofstream(config + ".edit", std::ios::trunc) << kFile;
    std::filesystem::rename(config + ".edit", config);
  }

  // The result of one change, of which the n-th allocation fails.
  template <typename Request>
  int change(const Request& request, int tag, const char* normal_dn, long n, bool& hit) {
    const auto home = std::make_shared<Home>(services.output);
    const auto root = std::make_shared<Identity>(Identity{"CN=ROOT", 0x0C, 0, "CN=CONFIGURATION"});
    const auto operation = std::make_shared<PendingOperation>(home, root, 1, tag, AnswerLimits{});
    operation->failure_limit = std::int64_t{1} << 40;
    EXPECT_EQ(operation->prepare(services, request, normal_dn).code, 0);
    EXPECT_EQ(enter_at_once(host.gate()), Gate::Entry::inside) << "the gate is open again";
    AllocationFault fault(n);
    operation->run(services, true);
    fault.disarm();
    hit = fault.hit();
    return operation->answer().answered() ? operation->answer().code() : operation->outcome();
  }

  template <typename Request>
  void expect_all_or_nothing(const Request& request, int tag, const char* normal_dn) {
    bool hit = false;
    put_back();
    const std::string before = content();
    ASSERT_EQ(change(request, tag, normal_dn, 0, hit), 0);
    const std::string after = content();
    ASSERT_NE(before, after);
    int refused = 0;
    for (long n = 1;; ++n) {
      SCOPED_TRACE("allocation " + std::to_string(n));
      put_back();
      const int code = change(request, tag, normal_dn, n, hit);
      EXPECT_EQ(content(), code == 0 ? after : before) << "answered with " << code;
      if (code != 0) ++refused;
      if (!hit || HasFailure()) break;
    }
    EXPECT_GT(refused, 10);
  }

  BackendHost host{StartedBackend::instance().backend, [](std::string_view) {}};
  ScriptedAuthenticator authenticator;
  Logs logs;
  asio::thread_pool changes{1};
  asio::thread_pool verifiers{1};
  Services services;
};

TEST_F(MemoryOfTheBackend, AddIsMadeWholeOrRefused) {
  expect_all_or_nothing(AddRequest{kBox,
                                   {{"objectClass", {"top", "container"}},
                                    {"cn", {"box"}},
                                    {"description", {"a text that is not short", "another"}}}},
                        tag::add_response, "CN=BOX,CN=SCHEMAS,CN=CONFIGURATION");
}

TEST_F(MemoryOfTheBackend, ModifyIsMadeWholeOrRefused) {
  expect_all_or_nothing(
      ModifyRequest{"cn=old,cn=schemas,cn=configuration",
                    {{0, {"description", {"a text that is not short", "another"}}},
                     {1, {"description", {"one"}}}}},
      tag::modify_response, "CN=OLD,CN=SCHEMAS,CN=CONFIGURATION");
}

TEST_F(MemoryOfTheBackend, DeleteIsMadeOrRefused) {
  expect_all_or_nothing(DeleteRequest{"cn=old,cn=schemas,cn=configuration"}, tag::delete_response,
                        "CN=OLD,CN=SCHEMAS,CN=CONFIGURATION");
}

// Of a search nothing is written, so what remains is that it has a result, and the next one all.
TEST_F(MemoryOfTheBackend, SearchHasAResultAndTheNextOneFindsEverything) {
  put_back();
  const auto root = std::make_shared<Identity>(Identity{"CN=ROOT", 0x0C, 0, "CN=CONFIGURATION"});
  const auto search = [&](long n, std::int64_t& entries, bool& hit) {
    SearchRequest request;
    request.scope = 2;
    request.filter = "(&(objectClass=*)(!(description=*not there*)))";
    request.attributes = {"cn", "description"};
    const auto home = std::make_shared<Home>(services.output);
    const auto operation =
        std::make_shared<PendingOperation>(home, root, 1, tag::search_done, AnswerLimits{});
    EXPECT_EQ(operation->prepare_search(services, request, "CN=CONFIGURATION").code, 0);
    EXPECT_EQ(enter_at_once(host.gate()), Gate::Entry::inside) << "the gate is open again";
    AllocationFault fault(n);
    operation->run(services, true);
    fault.disarm();
    hit = fault.hit();
    entries = operation->answer().entries();
    return operation->outcome();
  };
  bool hit = false;
  std::int64_t entries = 0;
  ASSERT_EQ(search(0, entries, hit), 0);
  ASSERT_EQ(entries, 4);
  int refused = 0;
  for (long n = 1;; ++n) {
    SCOPED_TRACE("allocation " + std::to_string(n));
    const int code = search(n, entries, hit);
    EXPECT_TRUE(code != 0 || entries == 4) << entries << " entries, and yet a success";
    if (code != 0) ++refused;
    bool none = false;
    EXPECT_EQ(search(0, entries, none), 0);
    EXPECT_EQ(entries, 4);
    if (!hit || HasFailure()) break;
  }
  EXPECT_GT(refused, 10);
}

}  // namespace
}  // namespace orv::server::test
