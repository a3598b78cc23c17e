#include "settings.h"

#include <charconv>
#include <limits>
#include <optional>

#include "cfg/owners.h"
#include "cfg/result_codes.h"
#include "cfg/session.h"
#include "cfg/text.h"

namespace orv::server {
namespace {

constexpr std::int64_t kMaxSeconds = 86400;
constexpr std::int64_t kMaxCount = 1000000;
constexpr std::int64_t kGigabyte = 1 << 30;

constexpr SettingRow kRows[] = {
    {"orv-slapdPort", 0, 65535, &Settings::port, true},
    {"orv-slapdSizeLimit", 0, std::numeric_limits<std::int32_t>::max(), &Settings::size_limit,
     false},
    {"orv-slapdTimeLimit", 0, kMaxSeconds, &Settings::time_limit, false},
    {"orv-slapdIdleTimeOut", 0, kMaxSeconds, &Settings::idle_timeout, false},
    {"orv-slapdMaxMessageSize", 1024, kGigabyte, &Settings::max_message_size, false},
    {"orv-slapdMaxConnections", 1, kMaxCount, &Settings::max_connections, false},
    {"orv-slapdMaxConnectionsPerAddress", 1, kMaxCount, &Settings::max_connections_per_address,
     false},
    {"orv-slapdMaxPendingOperations", 1, kMaxCount, &Settings::max_pending_operations, false},
    {"orv-slapdMaxFilterDepth", 1, 1024, &Settings::max_filter_depth, false},
    {"orv-slapdMaxControls", 1, kMaxCount, &Settings::max_controls, false},
    {"orv-slapdMaxAttributes", 1, kMaxCount, &Settings::max_attributes, false},
    {"orv-slapdMaxValues", 1, kMaxCount, &Settings::max_values, false},
    {"orv-slapdMaxResultSize", 1024, kGigabyte, &Settings::max_result_size, false},
    {"orv-slapdOperationWait", 1, kMaxSeconds, &Settings::operation_wait, false},
    {"orv-slapdWriteTimeOut", 1, kMaxSeconds, &Settings::write_timeout, false},
    {"orv-slapdMessageTimeOut", 1, kMaxSeconds, &Settings::message_timeout, false},
};

constexpr const char* kConfiguration = "CN=CONFIGURATION";
constexpr const char* kErrorLogEntry = "CN=DEFAULT,CN=LOG MANAGEMENT,CN=CONFIGURATION";
constexpr const char* kAccessLogEntry = "CN=ACCESS,CN=LOG MANAGEMENT,CN=CONFIGURATION";

CfgSession open_session(const std::string& config_file, const std::string& key_stash_file,
                        std::string& error) {
  CfgSession session(cfg_init(nullptr, 0));
  if (!session) {
    error = "out of memory";
    return session;
  }
  cfg_set_option(session.get(), kCfgOptDiagnostics, 1);
  cfg_set_option(session.get(), kCfgOptDiagnosticsFile, 1);
  cfg_set_option(session.get(), kCfgOptConfigFile, config_file.c_str());
  if (!key_stash_file.empty())
    cfg_set_option(session.get(), kCfgOptKeyStashFile, key_stash_file.c_str());
  if (cfg_bind_s(session.get(), nullptr, nullptr, 128) == result::success) return session;
  error = cfg_dump_exception(session.get());
  if (error.empty()) error = config_file + ": cannot be read";
  return nullptr;
}

// One entry of the file, for as long as the session lives.
class FileEntry {
 public:
  FileEntry(_CFG* session, const char* dn) : session_(session) {
    _CFGMessage* chain = nullptr;
    code_ = cfg_search_s(session, dn, kScopeBase, nullptr, nullptr, 0, &chain);
    chain_.reset(chain);
    entry_ = code_ == result::success ? cfg_first_entry(session, chain) : nullptr;
  }

  int code() const { return code_; }

  std::vector<std::string> values(const char* attribute) const {
    std::vector<std::string> found;
    const CfgValues values(entry_ ? cfg_get_values(session_, entry_, attribute) : nullptr);
    for (char** value = values.get(); value && *value; ++value) found.emplace_back(*value);
    return found;
  }

  std::optional<std::string> first(const char* attribute) const {
    std::vector<std::string> found = values(attribute);
    if (found.empty()) return std::nullopt;
    return std::move(found.front());
  }

 private:
  _CFG* session_;
  int code_ = 0;
  CfgResult chain_;
  _CFGMessage* entry_ = nullptr;
};

bool read_log(_CFG* session, const char* dn, std::string& path, std::string& level,
              std::string& error) {
  const FileEntry entry(session, dn);
  if (entry.code() == result::success) level = "info";
  path = entry.first("orv-slapdLog").value_or("");
  level = entry.first("orv-slapdLogLevel").value_or(level);
  for (char& c : level)
    if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
  if (!path.empty() && path.front() != '/') {
    error = std::string(dn) + ": orv-slapdLog is not an absolute path";
    return false;
  }
  for (const std::string_view known : {"error", "warning", "info", "debug", "off"})
    if (level == known) return true;
  error = std::string(dn) + ": orv-slapdLogLevel is none of error, warning, info, debug, off";
  return false;
}

bool read_integers(const FileEntry& top, Settings& settings, std::string& error) {
  for (const SettingRow& row : setting_rows()) {
    const std::optional<std::string> value = top.first(std::string(row.name).c_str());
    if (value && !apply_setting(row, *value, settings, error)) return false;
  }
  return true;
}

}  // namespace

std::span<const SettingRow> setting_rows() noexcept {
  return kRows;
}

bool apply_setting(const SettingRow& row, std::string_view value, Settings& settings,
                   std::string& error) {
  std::int64_t number = 0;
  const auto [end, status] = std::from_chars(value.data(), value.data() + value.size(), number);
  if (status == std::errc() && end == value.data() + value.size() && number >= row.minimum &&
      number <= row.maximum) {
    settings.*row.member = number;
    return true;
  }
  error = std::string(row.name) + " must be an integer from " + std::to_string(row.minimum) +
          " to " + std::to_string(row.maximum);
  return false;
}

bool read_settings(const std::string& config_file, const std::string& key_stash_file,
                   Settings& settings, std::string& error) {
  const CfgSession session = open_session(config_file, key_stash_file, error);
  if (!session) return false;
  const FileEntry top(session.get(), kConfiguration);
  if (top.code() != result::success) {
    error = config_file + ": has no entry " + kConfiguration;
    return false;
  }
  Settings read;
  read.addresses = top.values("orv-slapdIpAddress");
  if (read_integers(top, read, error) &&
      read_log(session.get(), kErrorLogEntry, read.error_log, read.error_log_level, error) &&
      read_log(session.get(), kAccessLogEntry, read.access_log, read.access_log_level, error)) {
    settings = std::move(read);
    return true;
  }
  error = config_file + ": " + error;
  return false;
}

std::vector<std::string_view> restart_needed(const Settings& running, const Settings& wanted) {
  std::vector<std::string_view> names;
  for (const SettingRow& row : setting_rows())
    if (row.needs_restart && running.*row.member != wanted.*row.member) names.push_back(row.name);
  if (running.addresses != wanted.addresses) names.push_back("orv-slapdIpAddress");
  return names;
}

}  // namespace orv::server
