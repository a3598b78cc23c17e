#include "auth/identities.h"

#include <algorithm>
#include <unordered_map>
#include <utility>

#include "auth/identity_reader.h"
#include "cfg/dn.h"
#include "slapi/codepage.h"
#include "slapi/owners.h"

namespace orv::server {
namespace {

// The password in the form in which the file keeps it. False when it has none: a text with a NUL or
// with characters that the file's code page lacks is nobody's password.
bool to_file_form(std::string_view password, std::string& form) {
  if (password.find('\0') != std::string_view::npos) return false;
  form = password;
  if (local_code_page_is_utf8()) return true;
  char* converted = nullptr;
  std::size_t length = 0;
  const int code = xlate_utf8_to_localcp(form.c_str(), &converted, &length);
  const MallocText text(converted);
  cfg::wipe(form);
  if (code != 0) return false;
  form = text.get();
  cfg::wipe(text.get(), form.size());
  return true;
}

// Wiped when it goes out of scope, on every way out.
class Secret {
 public:
  Secret() = default;
  ~Secret() { cfg::wipe(text); }
  Secret(const Secret&) = delete;
  Secret& operator=(const Secret&) = delete;
  std::string text;
};

}  // namespace

struct Identities::Data {
  cfg::KeyPtr key;
  std::vector<IdentityRecord> records;
  std::unordered_map<std::string_view, const IdentityRecord*> by_dn;  // null: claimed twice

  ~Data() {
    for (IdentityRecord& record : records) cfg::wipe(record.stored_password);
  }

  void index(std::vector<std::string>& warnings) {
    for (const IdentityRecord& record : records) {
      const auto [place, fresh] = by_dn.try_emplace(record.identity.bound_dn, &record);
      if (fresh) continue;
      place->second = nullptr;
      warnings.push_back(record.identity.entry_dn +
                         ": another entry has the same bind DN, nobody can bind with it");
    }
  }

  const IdentityRecord* find(std::string_view name) const {
    std::string normal;
    if (cfg::normalize_dn(name, normal) != 0 || !may_be_bound(normal)) return nullptr;
    const auto place = by_dn.find(normal);
    if (place == by_dn.end() || place->second == nullptr) return nullptr;
    const IdentityRecord* record = place->second;
    return record->enabled && !record->stored_password.empty() ? record : nullptr;
  }

  const Identity* verify(std::string_view name, std::string_view password) const {
    Secret form;
    const bool possible = to_file_form(password, form.text);
    const IdentityRecord* record = possible ? find(name) : nullptr;
    if (record == nullptr) {
      cfg::verify_nothing(password);
      return nullptr;
    }
    const cfg::SecretPlace place{record->password_type, record->identity.entry_dn};
    const bool proven = cfg::verify_secret(key.get(), place, record->stored_password, form.text);
    return proven ? &record->identity : nullptr;
  }
};

Identities::Identities() = default;
Identities::~Identities() = default;

std::shared_ptr<const Identities> Identities::read(const char* config_file,
                                                   const char* key_stash_file, std::string& error,
                                                   std::vector<std::string>& warnings) noexcept {
  try {
    IdentityRecords read;
    if (!read_identity_records(config_file, key_stash_file, read, error, warnings)) return nullptr;
    std::shared_ptr<Identities> identities(new Identities);
    identities->data_ = std::make_unique<Data>();
    identities->data_->key = std::move(read.key);
    identities->data_->records = std::move(read.records);
    identities->data_->index(warnings);
    return identities;
  } catch (...) {
    error.assign("out of memory");
    return nullptr;
  }
}

const Identity* Identities::authenticate(std::string_view name,
                                         std::string_view password) const noexcept {
  // RFC 4513, 5.1.2: a name without a password proves nothing, and takes no verification to see.
  if (password.empty()) return nullptr;
  try {
    return data_->verify(name, password);
  } catch (...) {
    return nullptr;
  }
}

}  // namespace orv::server
