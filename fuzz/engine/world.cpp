#include "world.h"

#include <asio/post.hpp>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <future>
#include <utility>
#include <vector>

#include "cfg/attribute_table.h"
#include "cfg/diagnostics.h"
#include "cfg/object_class_table.h"
#include "cfg/session.h"
#include "directory_backend.h"
#include "ops/persistent_search.h"
#include "plugin/loader.h"
#include "protocol/control_values.h"
#include "publish/root_dse.h"
#include "publish/subschema.h"
#include "question.h"
#include "slapi/administrators.h"
#include "slapi/backends.h"
#include "slapi/codepage.h"
#include "slapi/control.h"
#include "slapi/log.h"
#include "slapi/schema.h"

namespace orv::fuzz {
namespace {

using server::Identity;

constexpr int kEveryOperation = -1;
// Logs begin anew when they have grown so far.
constexpr std::uintmax_t kMostLog = std::uintmax_t{16} << 20;

const std::string& file_text() {
  static const std::string text =
      std::string(
          "dn: CN=CONFIGURATION\nobjectClass: top\nobjectClass: orv-slapdConfigEntry\n"
          "objectClass: orv-slapdTop\ncn: Configuration\norv-slapdAdminDN: cn=root\n"
          "orv-slapdAdminPW: ") +
      kSecret +
      "\norv-slapdAdminGroupEnabled: TRUE\norv-slapdPwEncryption: SSHA512\n\n"
      "dn: CN=ADMINGROUP,CN=CONFIGURATION\nobjectClass: top\nobjectClass: container\n"
      "objectClass: orv-slapdAdminGroupSettings\ncn: AdminGroup\n"
      "orv-slapdPwEncryptionAllowed: none\norv-slapdPwEncryptionAllowed: SSHA512\n\n"
      "dn: CN=MEMBER,CN=ADMINGROUP,CN=CONFIGURATION\nobjectClass: top\n"
      "objectClass: orv-slapdConfigEntry\nobjectClass: orv-slapdAdminGroupMember\ncn: member\n"
      "orv-slapdAdminDN: cn=member\norv-slapdAdminPW: " +
      kSecret +
      "\norv-slapdAdminRole: ServerConfigGroupMember\n\n"
      "dn: CN=MASTER SERVER,CN=CONFIGURATION\nobjectClass: top\n"
      "objectClass: orv-slapdConfigEntry\nobjectClass: orv-slapdReplication\ncn: Master Server\n"
      "orv-slapdMasterDN: cn=supplier\norv-slapdMasterPW: " +
      kSecret +
      "\n\n"
      "dn: CN=PWDPOLICY ADMIN,CN=CONFIGURATION\nobjectClass: top\n"
      "objectClass: orv-slapdConfigEntry\nobjectClass: orv-slapdAdminPolicy\n"
      "cn: PwdPolicy Admin\norv-slapdAdminPolicyEnabled: TRUE\npwdMinLength: 12\n"
      "passwordMinAlphaChars: 2\npasswordMinOtherChars: 2\npasswordMaxRepeatedChars: 2\n"
      "passwordMinDiffChars: 3\npwdLockout: FALSE\npwdMaxFailure: 10\n"
      "pwdFailureCountInterval: 900\npwdLockoutDuration: 900\n\n"
      "dn: CN=LOG MANAGEMENT,CN=CONFIGURATION\nobjectClass: top\nobjectClass: container\n"
      "cn: Log Management\n\n"
      "dn: CN=KERBEROS,CN=CONFIGURATION\nobjectClass: top\nobjectClass: orv-slapdConfigEntry\n"
      "objectClass: orv-slapdKerberos\ncn: Kerberos\norv-slapdKrbAdminDN: cn=krb\n\n"
      "dn: CN=SCHEMAS,CN=CONFIGURATION\nobjectClass: top\nobjectClass: container\ncn: Schemas\n\n"
      "dn: CN=OLD,CN=SCHEMAS,CN=CONFIGURATION\nobjectClass: top\nobjectClass: container\n"
      "cn: old\ndescription: one\ndescription: two\n";
  return text;
}

void quiet_message(int, int, int, const char*) noexcept {}
void quiet_line(const char*) noexcept {}

// What the process has once. It is never destroyed: the backend keeps what it was started with.
struct Ground {
  static Ground& get() {
    static auto* const ground = new Ground;
    return *ground;
  }

  // Makes the file what it was at first; nothing to do when nobody has touched it.
  void restore() {
    std::error_code none;
    if (touched || std::filesystem::last_write_time(config, none) != written)
      write_file(file_text());
    touched = false;
    for (const char* log : {"/audit.log", "/access.log"})
      if (std::filesystem::file_size(folder + log, none) > kMostLog && !none)
        std::filesystem::resize_file(folder + log, 0);
  }
  void write_file(const std::string& text) {
    std::ofstream(config + ".edit", std::ios::trunc) << text;
    std::filesystem::rename(config + ".edit", config);
    written = std::filesystem::last_write_time(config);
    touched = true;
  }
  void renew() {
    std::string error;
    require(server::renew_password_policy(config, "", error) == 0, "the policy is taken over");
    require(server::renew_password_methods(config, "", error) == 0, "the methods are taken over");
  }

  std::string folder;
  std::string config;
  bool touched = false;
  std::filesystem::file_time_type written;
  const char* suffixes[2] = {"CN=CONFIGURATION", nullptr};
  Backend backend;
  server::DirectoryBackend directory;
  server::Logs logs;
  server::AuditLog audit{[](std::string_view) {}};

 private:
  Ground() {
    std::string pattern = (std::filesystem::temp_directory_path() / "orv-fuzz-XXXXXX").string();
    require(mkdtemp(pattern.data()) != nullptr, "a folder");
    folder = pattern;
    config = folder + "/config.ldif";
    std::atexit([] { std::filesystem::remove_all(get().folder); });
    set_message_sink(quiet_message);
    cfg::set_diagnostics_sink(quiet_line);
    require(cfg::register_attribute_types(builtin_schema().attribute_table()) == 0, "types");
    require(cfg::register_object_classes(builtin_schema().object_class_table()) == 0, "classes");
    require(initIconvHandle() == 0, "a converter");
    write_file(file_text());
    start();
    renew();
    server::Settings logged;
    logged.error_log_level = "off";
    logged.access_log = folder + "/access.log";
    logged.access_log_level = "info";
    require(logs.open(logged).empty(), "an access log");
    require(audit.open(folder + "/audit.log", {}).empty(), "an audit log");
  }
  void start() {
    backend.suffixes = suffixes;
    backend.handlers = slapi_pblock_new();
    server::PluginError failure;
    server::LoadedPlugin plugin =
        server::load_plugin(ORV_PLUGIN, "config_backend_init", backend.handlers, failure);
    require(static_cast<bool>(plugin), failure.text.c_str());
    plugin.release();
    auto* const startup = static_cast<BackendStartup*>(std::calloc(1, sizeof(BackendStartup)));
    startup->config_file = config.c_str();
    backend.private_data = startup;
    require(slapi_pblock_instance_start(backend.handlers)(&backend) == 0, "the backend starts");
    require(register_backend(&backend) == 0, "the backend is registered");
    for (const char* oid :
         {server::kPersistentSearchOid, server::kEntryChangeOid, server::kPagedResultsOid,
          server::kAssertionOid, server::kPreReadOid, server::kPostReadOid})
      slapi_register_supported_control(oid, kEveryOperation);
  }
};

// Limits that an input of a few hundred bytes can reach.
server::Settings small_settings() {
  server::Settings settings;
  settings.max_message_size = 16384;
  settings.max_pending_operations = 4;
  settings.max_filter_depth = 6;
  settings.max_controls = 3;
  settings.max_attributes = 5;
  settings.max_values = 12;
  settings.max_result_size = 8192;
  settings.max_persistent_searches = 3;
  settings.max_persistent_searches_per_connection = 2;
  settings.max_paged_searches = 2;
  settings.max_paged_result_size = 4096;
  settings.max_failed_change_size = 8192;
  settings.time_limit = 0;
  return settings;
}

constexpr std::size_t kCeiling = std::size_t{24} << 10;

}  // namespace

void require(bool holds, const char* what) {
  if (holds) return;
  std::fprintf(stderr, "does not hold: %s\n", what);
  std::abort();
}

// As the server has them: by the file, and the failures of binds counted.
class Round::Identities final : public server::Authenticator, public server::ExternalIdentities {
 public:
  explicit Identities(const std::string& config)
      : store_(config, "", {}, [config] {
          std::string error;
          return server::renew_administrators(config, "", error) == 0;
        }) {
    std::string error;
    std::vector<std::string> warnings;
    require(store_.reload(error, warnings), "the identities can be read");
  }
  std::shared_ptr<const Identity> authenticate(std::string_view name,
                                               std::string_view password) override {
    const auto all = store_.current();
    const Identity* found = all->authenticate(name, password);
    if (!settle_administrator_bind(name, found != nullptr, std::chrono::steady_clock::now()))
      return nullptr;
    return found ? std::shared_ptr<const Identity>(all, found) : nullptr;
  }
  std::shared_ptr<const Identity> primary_administrator() override {
    const auto all = store_.current();
    const Identity* const found = all->primary_administrator();
    return found ? std::shared_ptr<const Identity>(all, found) : nullptr;
  }
  std::shared_ptr<const Identity> of_certificate(std::string_view subject) override {
    return store_.current()->of_certificate(subject);
  }
  std::uint64_t generation() const noexcept override { return store_.generation(); }
  bool still_valid(const Identity& bound) const noexcept override {
    return store_.latest()->still_valid(bound);
  }
  bool may_define(std::string_view entry_dn) const noexcept override {
    return store_.latest()->defined_by(entry_dn);
  }
  bool refresh() {
    const std::uint64_t before = store_.generation();
    store_.current();
    return store_.generation() != before;
  }

 private:
  server::IdentityStore store_;
};

Round::Round()
    : settings_(small_settings()),
      host_(Ground::get().backend, [](std::string_view) {}),
      services_{builtin_schema(),
                host_,
                *[this] {
                  Ground& ground = Ground::get();
                  const bool changed = ground.touched;
                  ground.restore();
                  if (changed) ground.renew();
                  identities_ = std::make_unique<Identities>(ground.config);
                  return identities_.get();
                }(),
                {},
                Ground::get().logs,
                slapi_supported_controls(),
                changes_,
                verifiers_,
                {},
                {},
                server::OutputMeter(kCeiling)},
      lane_(Ground::get().logs) {
  static const std::shared_ptr<const entry> subschema = server::make_subschema(builtin_schema(), 0);
  services_.publications = {[](const server::Offer& offer) {
                              server::ServerFacts facts;
                              facts.naming_contexts = {"cn=configuration"};
                              facts.sasl_mechanisms = offer.sasl_mechanisms;
                              return std::shared_ptr<const entry>(server::make_root_dse(facts));
                            },
                            [] { return subschema; }};
  services_.take_over = [this](const server::Consequences& consequences, bool made) {
    Ground::get().touched = true;
    std::string error;
    const bool read = (consequences.identities || !made) && identities_->refresh();
    if (made && consequences.policy) server::renew_password_policy(Ground::get().config, "", error);
    if (made && consequences.methods)
      server::renew_password_methods(Ground::get().config, "", error);
    return read;
  };
  services_.changes_made = cfg_changes_made;
  services_.audit = &Ground::get().audit;
  mechanisms_.push_back(server::make_external(*identities_));
  mechanisms_.push_back(std::make_unique<Question>());
  services_.mechanisms = &mechanisms_;
}

Round::~Round() {
  changes_.join();
  verifiers_.join();
}

void Round::damage_file() {
  Ground::get().write_file("dn: CN=CONFIGURATION\nobjectClass: top\n\nthis is no line\n");
}

void Round::mend_file() {
  Ground::get().write_file(file_text());
}

void Round::wait_for_workers() {
  for (asio::thread_pool* pool : {&changes_, &verifiers_}) {
    std::promise<void> done;
    asio::post(*pool, [&done] { done.set_value(); });
    done.get_future().wait();
  }
  Ground::get().audit.settle();
}

namespace {

class NoWaiter final : public server::GateWaiter {
  void gate_decided(server::Verdict) noexcept override {}
};

}  // namespace

void Round::check_rest() {
  require(!host_.failed(), "no handler threw");
  require(gate().waiting() == 0, "nobody waits at the gate");
  require(gate().enter(std::make_shared<NoWaiter>(), server::Clock::time_point::max()) ==
              server::Gate::Entry::inside,
          "the gate is open");
  gate().leave();
  require(services_.unauthenticated.load() == 0, "no connection counts as unauthenticated");
  require(services_.output.room() == kCeiling, "no output is counted as unread");
  require(services_.kept_pages.bytes() == 0, "no pages are kept");
  server::PersistentSearch one({}, 1, {}, {}, "", "");
  require(services_.persistent_searches.count(one, 1), "no persistent search is counted");
  services_.persistent_searches.leave(one);
}

}  // namespace orv::fuzz
