// orvd: reads its configuration, loads the configuration backend and serves it over LDAP.
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <functional>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "audit/log.h"
#include "auth/identities.h"
#include "auth/sasl_cyrus.h"
#include "auth/sasl_external.h"
#include "broken_file.h"
#include "cfg/attribute_table.h"
#include "cfg/diagnostics.h"
#include "cfg/masked_dn.h"
#include "cfg/object_class_table.h"
#include "cfg/result_codes.h"
#include "cfg/session.h"
#include "directory_backend.h"
#include "file_report.h"
#include "guarded_file.h"
#include "logs.h"
#include "net/tls.h"
#include "ops/persistent_search.h"
#include "options.h"
#include "plugin/loader.h"
#include "process/call_filter.h"
#include "process/file_access.h"
#include "process/key_memory.h"
#include "process/privileges.h"
#include "process/service_manager.h"
#include "process/surroundings.h"
#include "publish/root_dse.h"
#include "publish/subschema.h"
#include "server.h"
#include "settings.h"
#include "slapi/account.h"
#include "slapi/administrators.h"
#include "slapi/backends.h"
#include "slapi/codepage.h"
#include "slapi/control.h"
#include "slapi/file_trust.h"
#include "slapi/globals.h"
#include "slapi/log.h"
#include "slapi/schema.h"
#include "slapi/trace.h"
#include "standard_error.h"

namespace orv::server {
namespace {

constexpr const char* kSuffix = "CN=CONFIGURATION";
constexpr const char* kEntryPoint = "config_backend_init";
constexpr int kServerWithoutControls = 3;
constexpr int kEveryOperation = -1;

// ---- where the libraries write to

Logs* sink_logs = nullptr;  // set while there are logs

void message_to_log(int, int, int number, const char* text) noexcept {
  if (!sink_logs) return;
  try {
    sink_logs->warning("message " + std::to_string(number) + ": " + text);
  } catch (...) {
  }
}

void diagnostics_to_log(const char* line) noexcept {
  if (sink_logs) sink_logs->warning(line);
}

// ---- who may bind

// What was found in a file that changed.
void tell(Logs& logs, const std::string& error, const std::vector<std::string>& warnings) noexcept {
  try {
    if (!error.empty()) logs.error("the identities stay as they were: " + error);
  } catch (...) {
  }
  for (const std::string& warning : warnings) logs.warning(warning);
}

class StoredIdentities final : public Authenticator,
                               public ExternalIdentities,
                               public SaslIdentities {
 public:
  // `follow` as in IdentityStore.
  StoredIdentities(const Options& options, Logs& logs, std::function<bool()> follow)
      : store_(
            options.config_file, options.key_stash_file,
            [&logs](const std::string& error, const std::vector<std::string>& warnings) {
              tell(logs, error, warnings);
            },
            std::move(follow)),
        logs_(logs) {}

  bool reload(std::string& error) {
    std::vector<std::string> warnings;
    const bool good = store_.reload(error, warnings);
    for (const std::string& warning : warnings) logs_.warning(warning);
    return good;
  }

  std::shared_ptr<const Identity> authenticate(std::string_view name,
                                               std::string_view password) override {
    const std::shared_ptr<const Identities> identities = store_.current();
    if (!identities) return nullptr;
    const Identity* found = identities->authenticate(name, password);
    if (!settle_administrator_bind(name, found != nullptr, std::chrono::steady_clock::now()))
      found = nullptr;
    if (!found && identities->claimed_twice(name)) tell_of_claim(name);
    if (!found) return nullptr;
    return {identities, found};  // the snapshot lives as long as somebody is bound by it
  }

  std::shared_ptr<const Identity> primary_administrator() override {
    const std::shared_ptr<const Identities> identities = store_.current();
    const Identity* const found = identities ? identities->primary_administrator() : nullptr;
    if (!found) return nullptr;
    return {identities, found};
  }

  std::shared_ptr<const Identity> of_certificate(std::string_view subject) override {
    const std::shared_ptr<const Identities> identities = store_.current();
    return identities ? identities->of_certificate(subject) : nullptr;
  }

  std::shared_ptr<const Identity> of_user(std::string_view name, std::string& password) override {
    const std::shared_ptr<const Identities> identities = store_.current();
    if (!identities) return nullptr;
    std::string unreadable;
    std::shared_ptr<const Identity> found = identities->of_user(name, password, unreadable);
    if (!unreadable.empty()) tell_of_unreadable(unreadable);
    return found;
  }

  std::shared_ptr<const Identity> of_principal(std::string_view principal) override {
    const std::shared_ptr<const Identities> identities = store_.current();
    return identities ? identities->of_principal(principal) : nullptr;
  }

  bool settle(const Identity& identity, bool proved) noexcept override {
    return settle_administrator_bind(identity.bound_dn, proved, std::chrono::steady_clock::now());
  }

  bool has_users() const noexcept override {
    const std::shared_ptr<const Identities> identities = store_.latest();
    return identities && identities->has_users();
  }

  bool has_principals() const noexcept override {
    const std::shared_ptr<const Identities> identities = store_.latest();
    return identities && identities->has_principals();
  }

  bool maps_certificates() const noexcept override {
    const std::shared_ptr<const Identities> identities = store_.latest();
    return identities && identities->maps_certificates();
  }

  std::uint64_t generation() const noexcept override { return store_.generation(); }

  bool still_valid(const Identity& bound) const noexcept override {
    const std::shared_ptr<const Identities> identities = store_.latest();
    return identities && identities->still_valid(bound);
  }

  bool may_define(std::string_view entry_dn) const noexcept override {
    const std::shared_ptr<const Identities> identities = store_.latest();
    return !identities || identities->defined_by(entry_dn);
  }

  // Reads what has changed; what is found is told. Whether something was read.
  bool refresh() noexcept {
    const std::uint64_t before = store_.generation();
    store_.current();
    return store_.generation() != before;
  }

 private:
  // Once for each reading of the file: strangers must not fill the log.
  void tell_of_claim(std::string_view name) {
    const std::uint64_t generation = store_.generation();
    if (told_.exchange(generation) == generation) return;
    std::string shown = "not a DN";
    cfg::mask_dn(name, cfg::UnknownTypes::shown, shown);
    std::string line = "nobody can bind as ";
    append_quoted(line, shown);
    logs_.error(line + ": more than one entry defines that identity");
  }

  // The same.
  void tell_of_unreadable(const std::string& entry_dn) {
    {
      const std::lock_guard lock(unreadable_mutex_);
      const std::uint64_t generation = store_.generation();
      if (std::exchange(unreadable_read_, generation) != generation) unreadable_told_.clear();
      if (!unreadable_told_.insert(entry_dn).second) return;
    }
    std::string line;
    append_quoted(line, entry_dn);
    logs_.warning(line +
                  ": the password does not serve DIGEST-MD5 and SCRAM-SHA-256, which need one that "
                  "is stored in clear or sealed, not hashed: set orv-slapdPwEncryption to AES256, "
                  "and the password anew");
  }

  IdentityStore store_;
  Logs& logs_;
  std::atomic<std::uint64_t> told_{0};
  std::mutex unreadable_mutex_;
  std::uint64_t unreadable_read_ = 0;
  std::set<std::string> unreadable_told_;
};

// ---- what the rules know

// Reads one of the things that the rules go by, which stays as it was when that fails.
struct Renewal {
  const char* what;
  int (*renew)(const std::string& config_file, const std::string& key_stash_file,
               std::string& error);
};
constexpr Renewal kPolicy{"the password policy", renew_password_policy};
constexpr Renewal kMethods{"the method of storing passwords", renew_password_methods};
constexpr Renewal kAdministrators{"the administrators", renew_administrators};

// One at a time, so that what was read before a change never comes after what was read behind it.
bool renew(const Renewal& renewal, const Options& options, Logs& logs) noexcept {
  static std::mutex renewing;
  try {
    const std::lock_guard lock(renewing);
    std::string error;
    const int code = renewal.renew(options.config_file, options.key_stash_file, error);
    if (code == result::success) return true;
    if (error.empty()) error = "result " + std::to_string(code);
    if (code == result::no_such_object) error = "the configuration file has no entry for it";
    logs.warning(std::string(renewal.what) + " stays as it was: " + error);
  } catch (...) {
    logs.error(renewal.what);
    logs.error("could not be read: out of memory");
  }
  return false;
}

// The administrators are taken over with the identities.
void renew_all(const Options& options, Logs& logs) noexcept {
  for (const Renewal& renewal : {kPolicy, kMethods}) renew(renewal, options, logs);
}

bool take_over(const Consequences& consequences, bool made, StoredIdentities& identities,
               const Options& options, Logs& logs) noexcept {
  // A change that failed is looked for: the old file could perhaps not be put back.
  const bool read = (consequences.identities || !made) && identities.refresh();
  if (!made && !read) return false;
  if (consequences.policy) renew(kPolicy, options, logs);
  if (consequences.methods) renew(kMethods, options, logs);
  return read;
}

// ---- the process

// What the process was given by whoever started it.
struct Inheritance {
  ServiceManager manager;
  std::vector<ListeningSocket> sockets;
};

bool prepare_process(Inheritance& inherited) {
  settle_standard_streams();
  close_inherited_descriptors(inherited_count());
  std::string error;
  // Without its notices the server serves all the same.
  if (!inherited.manager.connect(error)) std::fprintf(stderr, "orvd: %s\n", error.c_str());
  if (!inherit_sockets(inherited.sockets, error)) {
    std::fprintf(stderr, "orvd: %s\n", error.c_str());
    return false;
  }
  clean_environment();
  settle_process();
  forbid_core_dumps();
  forbid_new_privileges();
  return true;
}

bool become_user(const Options& options) {
  if (options.user.empty()) return true;
  Account account;
  std::string error;
  if (find_account(options.user, options.group, account, error) && become(account, error))
    return true;
  std::fprintf(stderr, "orvd: %s\n", error.c_str());
  return false;
}

bool report_problems(const std::vector<std::string>& problems) {
  for (const std::string& problem : problems) std::fprintf(stderr, "orvd: %s\n", problem.c_str());
  return problems.empty();
}

// Root may check the files of another user's instance, but does not serve them.
uid_t user_of_files(const Options& options) {
  const bool may_be_anybodys = options.check && geteuid() == 0;
  return may_be_anybodys ? owner_of(options.config_file, geteuid()) : geteuid();
}

std::vector<std::string> distrusted_files(const Options& options) {
  return orv::distrusted_files(options.named_config_file, options.named_key_stash,
                               user_of_files(options));
}

// Reports them, and to root also that it need not be the one to serve them.
bool trusts_files(const Options& options) {
  if (report_problems(distrusted_files(options))) return true;
  const uid_t owner = owner_of(options.config_file, 0);
  if (geteuid() == 0 && owner != 0)
    std::fprintf(stderr, "orvd: or start with --user %s, to serve as the owner of the file\n",
                 user_name(owner).c_str());
  return false;
}

// Files that nothing may be written to but what belongs there.
std::vector<std::string> own_files(const Options& options) {
  const std::string& config = options.config_file;  // without symbolic links
  std::vector<std::string> files = {config, options.key_stash_file,
                                    config.substr(0, config.rfind('/') + 1) + "admin.pw"};
  // What a change of the configuration file leaves beside it, and uses on the way.
  for (const char* const ending : {".save", ".save.new", ".lock", ".new", ".swap", ".rescued"})
    files.push_back(config + ending);
  return files;
}

// What no log may be: those, and where else something is written from the start to the end.
GuardedFiles guarded_files(const Options& options, const FileIdentity& standard_error) {
  GuardedFiles guarded{own_files(options), {}};
  guarded.names.push_back(options.trace_file);
  if (standard_error) guarded.in_use.push_back({standard_error, "standard error"});
  return guarded;
}

bool may_be_traced_to(const Options& options) {
  struct stat trace {};
  struct stat own {};
  if (options.trace_file.empty() || stat(options.trace_file.c_str(), &trace) != 0) return true;
  for (const std::string& file : own_files(options)) {
    if (stat(file.c_str(), &own) != 0 || own.st_dev != trace.st_dev || own.st_ino != trace.st_ino)
      continue;
    std::fprintf(stderr, "orvd: %s: the same file as %s\n", options.trace_file.c_str(),
                 file.c_str());
    return false;
  }
  return true;
}

bool apply_options(const Options& options) {
  g_srvType.store(options.server_type, std::memory_order_relaxed);
  g_safe_mode.store(options.safe_mode ? 1 : 0, std::memory_order_relaxed);
  set_ldap_debug(options.debug);
  if (!may_be_traced_to(options)) return false;
  if (options.trace_mask) trcEvents.store(*options.trace_mask, std::memory_order_relaxed);
  if (!options.trace_file.empty())
    if (const int failure = set_trace_file(options.trace_file.c_str())) {
      std::fprintf(stderr, "orvd: %s: %s\n", options.trace_file.c_str(), std::strerror(failure));
      return false;
    }
  set_local_code_page(options.code_page.empty() ? nullptr : options.code_page.c_str());
  // The backend sets the converter up too, but cannot say what was wrong.
  if (initIconvHandle() != 0) {
    std::fprintf(stderr, "orvd: unknown code page: %s\n",
                 options.code_page.empty() ? "the one of the locale" : options.code_page.c_str());
    return false;
  }
  open_message_catalogue((executable_directory() + "../share/orv/orvd.cat").c_str());
  return true;
}

// ---- the backend

// What the backend refers to for as long as the process lives.
struct BackendPlace {
  std::string config_file;
  std::string key_stash_file;
  const char* suffixes[2] = {kSuffix, nullptr};
  Backend backend;
};

bool start_backend(const Options& options, BackendPlace& place) {
  place.config_file = options.config_file;
  place.key_stash_file = options.key_stash_file;
  Backend& backend = place.backend;
  backend.suffixes = place.suffixes;
  backend.handlers = slapi_pblock_new();
  if (!backend.handlers) {
    std::fprintf(stderr, "orvd: out of memory\n");
    return false;
  }
  PluginError error;
  LoadedPlugin plugin = load_plugin(options.plugin_file, kEntryPoint, backend.handlers, error);
  if (!plugin) {
    std::fprintf(stderr, "orvd: %s\n", error.text.c_str());
    return false;
  }
  plugin.release();
  auto* const startup = static_cast<BackendStartup*>(std::calloc(1, sizeof(BackendStartup)));
  if (!startup) {
    std::fprintf(stderr, "orvd: out of memory\n");
    return false;
  }
  startup->config_file = place.config_file.c_str();
  startup->key_stash_file = place.key_stash_file.empty() ? nullptr : place.key_stash_file.c_str();
  backend.private_data = startup;
  const InstanceStart start = slapi_pblock_instance_start(backend.handlers);
  if (const int code = start(&backend)) {
    std::fprintf(stderr, "orvd: the backend does not start: result %d\n", code);
    return false;
  }
  if (register_backend(&backend) != result::success) {
    std::fprintf(stderr, "orvd: the backend cannot be registered\n");
    return false;
  }
  return true;
}

// The controls that the server itself understands; the backend has announced its own.
void announce_controls() {
  if (g_srvType.load(std::memory_order_relaxed) == kServerWithoutControls) return;
  slapi_register_supported_control(kPersistentSearchOid, kEveryOperation);
  slapi_register_supported_control(kEntryChangeOid, kEveryOperation);
  slapi_register_supported_control(kPagedResultsOid, kEveryOperation);
  slapi_register_supported_control(kAssertionOid, kEveryOperation);
  slapi_register_supported_control(kPreReadOid, kEveryOperation);
  slapi_register_supported_control(kPostReadOid, kEveryOperation);
}

// ---- the life of the server

Publications publications() {
  ServerFacts facts;
  facts.naming_contexts = {"cn=configuration"};
  facts.supported_extensions = {kWhoAmIOid, kCancelOid};
  facts.supported_features = {"1.3.6.1.4.1.4203.1.5.1"};  // all operational attributes, RFC 3673
  facts.restart_settings = restart_settings();
  facts.vendor_name = "orv";
  facts.vendor_version = ORV_VERSION;
  // The schema does not change while the server runs, and making the entry costs more than a
  // search.
  std::shared_ptr<const entry> subschema = make_subschema(builtin_schema(), std::time(nullptr));
  return {[facts](const Offer& offer) {
            ServerFacts shown = facts;
            shown.sasl_mechanisms = offer.sasl_mechanisms;
            shown.controls_off = offer.controls_off;
            if (offer.start_tls) shown.supported_extensions.emplace_back(kStartTlsOid);
            return std::shared_ptr<const entry>(make_root_dse(shown));
          },
          [subschema] { return std::shared_ptr<const entry>(subschema); }};
}

// What clients may bind with besides passwords.
SaslMechanisms make_mechanisms(StoredIdentities& identities, CyrusSasl& sasl) {
  SaslMechanisms mechanisms;
  mechanisms.push_back(
      offer_while([&sasl] { return sasl.allows("EXTERNAL"); }, make_external(identities)));
  sasl.add_mechanisms(mechanisms);
  return mechanisms;
}

// Text of a client's may be in it.
void tell_of_exchange(Logs& logs, std::string_view what) noexcept {
  try {
    std::string line = "bind: ";
    append_quoted(line, what);
    logs.write(LogLevel::debug, line);
  } catch (...) {
  }
}

bool can_use_certificate(const Options& options, const Settings& settings) {
  std::string error;
  if (settings.tls.certificate_file.empty() ||
      TlsContext::load(settings.tls, error, user_of_files(options)))
    return true;
  std::fprintf(stderr, "orvd: %s\n", error.c_str());
  return false;
}

void report(Logs& logs, const std::vector<std::string>& problems) {
  for (const std::string& problem : problems) logs.error(problem);
}

std::vector<FileInUse> files_of_keys(const Settings& settings) {
  const TlsSettings& tls = settings.tls;
  std::vector<FileInUse> files;
  for (const std::string& path :
       {tls.certificate_file, tls.key_file, tls.ca_file, tls.crl_file, settings.sasl.keytab})
    if (const FileIdentity file = file_at(path)) files.push_back({file, path});
  return files;
}

// Files besides its own that the server reads with these settings.
std::vector<std::string> files_to_read(const Settings& settings) {
  const TlsSettings& tls = settings.tls;
  const std::vector<std::string>& allowed = settings.sasl.mechanisms;
  std::vector<std::string> files;
  if (allowed.empty() || std::find(allowed.begin(), allowed.end(), "GSSAPI") != allowed.end())
    files.push_back(settings.sasl.keytab);
  if (tls.certificate_file.empty()) return files;
  files.insert(files.end(), {tls.certificate_file, tls.key_file});
  if (tls.client_certificates != ClientCertificates::none)
    files.insert(files.end(), {tls.ca_file, tls.crl_file});
  return files;
}

// The audit log first: what is its file then, wanted or not, is kept from the other logs.
void open_logs(const Settings& settings, GuardedFiles guarded, Logs& logs, AuditLog& audit) {
  std::vector<FileInUse> others = files_of_keys(settings);
  guarded.in_use.insert(guarded.in_use.end(), others.begin(), others.end());
  for (FileInUse& file : logs.files_in_use()) guarded.in_use.push_back(std::move(file));
  const std::string reason = audit.open(settings.audit_log, guarded);
  if (!reason.empty()) logs.error("cannot record changes in " + settings.audit_log + ": " + reason);
  for (FileInUse& file : audit.files_in_use()) others.push_back(std::move(file));
  report(logs, logs.open(settings, others));
}

// A second server of the same configuration, on another port, must not need the first one's places.
MoreListeners more_listeners(const Options& options, const Settings& settings) {
  MoreListeners more;
  more.secure_port = options.secure_port;
  if (!more.secure_port && settings.secure_port > 0)
    more.secure_port = options.port ? 0 : static_cast<std::uint16_t>(settings.secure_port);
  more.local_socket = options.local_socket.value_or(settings.local_socket);
  return more;
}

// Opens what may need root's right to low ports, and gives that up.
bool open_sockets(const Options& options, const Settings& settings,
                  std::vector<ListeningSocket>& sockets, std::string& error) {
  const bool inherited = std::any_of(sockets.begin(), sockets.end(), [](const auto& socket) {
    return socket.kind != ListenerKind::local;
  });
  if (inherited) return give_up_capabilities(error);
  const MoreListeners more = more_listeners(options, settings);
  const auto& addresses = options.addresses.empty() ? settings.addresses : options.addresses;
  const auto port = options.port.value_or(static_cast<std::uint16_t>(settings.port));
  const bool secure = more.secure_port && !settings.tls.certificate_file.empty();
  return open_tcp(addresses, port, false, sockets, error) &&
         (!secure || open_tcp(addresses, *more.secure_port, true, sockets, error)) &&
         give_up_capabilities(error);
}

void restrict_process(const Options& options, Logs& logs) {
  std::string why;
  if (geteuid() == 0)
    logs.warning("the server runs as root; make a user for it, and name that with --user");
  if (!options.call_filter) {
    logs.warning("system calls are not restricted, as --without-call-filter asks for");
  } else if (const CallFilter filter = restrict_calls(why); filter == CallFilter::on) {
    logs.info("system calls are restricted");
  } else {
    const std::string line = "system calls are not restricted: " + why;
    filter == CallFilter::refused ? logs.warning(line) : logs.info(line);
  }
}

int serve(const Options& options, const Settings& settings, const GuardedFiles& guarded, Logs& logs,
          AuditLog& audit, StoredIdentities& identities, BackendPlace& place,
          Inheritance& inherited) {
  BrokenFileReporter broken_file(options.config_file, options.key_stash_file, logs);
  std::string error;
  const std::unique_ptr<const SaslLibrary> library = SaslLibrary::open(error);
  if (!library) {
    std::fprintf(stderr, "orvd: %s\n", error.c_str());
    return 1;
  }
  CyrusSasl sasl(*library, identities,
                 [&logs](std::string_view what) { tell_of_exchange(logs, what); });
  report(logs, sasl.configure(settings.sasl));
  const SaslMechanisms mechanisms = make_mechanisms(identities, sasl);
  Server server({builtin_schema(), place.backend, identities, publications(), logs,
                 slapi_supported_controls(), settings,
                 std::max(1U, std::thread::hardware_concurrency()),
                 [&](Settings& wanted) {
                   std::string error;
                   if (!read_settings(options.config_file, options.key_stash_file, wanted, error) ||
                       !identities.reload(error)) {
                     logs.error("settings not taken over: " + error);
                     return false;
                   }
                   report(logs, distrusted_files(options));
                   report(logs, missing_read_access(files_to_read(wanted)));
                   renew_all(options, logs);
                   report(logs, sasl.configure(wanted.sasl));
                   open_logs(wanted, guarded, logs, audit);
                   configfile_read.fetch_add(1, std::memory_order_relaxed);
                   logs.info("settings taken over");
                   return true;
                 },
                 [&broken_file] { broken_file.note_failure(); }, &audit,
                 [&](const Consequences& consequences, bool made) {
                   return take_over(consequences, made, identities, options, logs);
                 },
                 options.guards, [&identities] { identities.refresh(); }, cfg_changes_made,
                 &mechanisms, &inherited.manager,
                 [&options](Settings& now) {
                   std::string error;
                   return read_settings(options.config_file, options.key_stash_file, now, error);
                 },
                 [&options](AdminPolicySettings& now) {
                   return read_policy_settings(options.config_file, options.key_stash_file, now);
                 }});
  if (!server.take(std::move(inherited.sockets), error) ||
      !server.listen({}, 0, error, more_listeners(options, settings))) {
    std::fprintf(stderr, "orvd: %s\n", error.c_str());
    return 1;
  }
  server.handle_signals();
  accept_hangup();
  restrict_process(options, logs);
  std::string urls;
  for (const std::string& url : server.urls()) urls += " " + url;
  logs.info("orvd " ORV_VERSION " serves " + options.config_file + " at" + urls);
  std::printf("orvd ready %s\n", server.url().c_str());
  std::fflush(stdout);
  return server.serve();
}

int run(const Options& options, const FileIdentity& standard_error, Inheritance& inherited) {
  if (!become_user(options) ||
      !report_problems(missing_read_access({options.config_file, options.key_stash_file})) ||
      !trusts_files(options))
    return 1;
  if (!apply_options(options)) return 1;
  if (cfg::register_attribute_types(builtin_schema().attribute_table()) != 0) return 1;
  if (cfg::register_object_classes(builtin_schema().object_class_table()) != 0) return 1;
  Settings settings;
  std::string error;
  if (!read_settings(options.config_file, options.key_stash_file, settings, error)) {
    std::fprintf(stderr, "orvd: %s\n", error.c_str());
    return 1;
  }
  const bool may_read = report_problems(missing_read_access(files_to_read(settings)));
  const bool may_write = report_problems(missing_write_access(
      options.config_file, settings, more_listeners(options, settings).local_socket));
  if (!may_read || !may_write) return 1;
  if (!options.check && !open_sockets(options, settings, inherited.sockets, error)) {
    std::fprintf(stderr, "orvd: %s\n", error.c_str());
    return 1;
  }
  configfile_read.store(1, std::memory_order_relaxed);

  const GuardedFiles guarded = guarded_files(options, standard_error);
  Logs logs(guarded);
  sink_logs = &logs;
  set_message_sink(message_to_log);
  cfg::set_diagnostics_sink(diagnostics_to_log);
  int status = 1;
  bool recorded = true;
  static BackendPlace place;  // referred to by what the backend keeps
  {
    StoredIdentities identities(
        options, logs, [&options, &logs] { return renew(kAdministrators, options, logs); });
    if (!identities.reload(error)) {
      std::fprintf(stderr, "orvd: %s\n", error.c_str());
    } else if (start_backend(options, place)) {
      const DirectoryBackend directory;
      renew_all(options, logs);
      for (const std::string& doubt :
           doubts_about_file(options.config_file, options.key_stash_file))
        logs.warning(doubt);
      if (options.check && !can_use_certificate(options, settings)) {
        status = 1;
      } else if (options.check) {
        std::printf("%s: good\n", options.config_file.c_str());
        status = 0;
      } else {
        AuditLog audit([&logs](std::string_view line) { logs.error(line); });
        open_logs(settings, guarded, logs, audit);
        announce_controls();
        status = serve(options, settings, guarded, logs, audit, identities, place, inherited);
        recorded = audit.finish();
      }
    }
  }
  const bool finished = logs.finish();
  sink_logs = nullptr;
  if (finished && recorded) return status;
  // Something still holds on to what destructors take away.
  drain_standard_error(StandardError::kPatience);
  std::_Exit(status);
}

}  // namespace
}  // namespace orv::server

int main(int argc, char** argv) {
  using namespace orv::server;
  if (!protect_keys()) std::fprintf(stderr, "orvd: keys may stay in memory after use\n");
  Options options;
  int status = 0;
  if (parse_options(argc, argv, options, status) == Parsed::exit) return status;
  Inheritance inherited;
  if (!prepare_process(inherited)) return 1;
  const FileIdentity standard_error_file = regular_file_of(STDERR_FILENO);
  const StandardError standard_error;
  try {
    return run(options, standard_error_file, inherited);
  } catch (const std::exception& error) {
    std::fprintf(stderr, "orvd: %s\n", error.what());
    return 1;
  }
}
