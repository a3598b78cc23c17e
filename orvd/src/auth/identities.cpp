#include "auth/identities.h"

#include <openssl/evp.h>

#include <algorithm>
#include <new>
#include <unordered_map>
#include <utility>

#include "auth/identity_reader.h"
#include "cfg/dn.h"
#include "cfg/result_codes.h"
#include "slapi/codepage.h"
#include "slapi/connection.h"
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
  if (code == result::no_memory) throw std::bad_alloc();
  if (code != 0) return false;
  form = text.get();
  cfg::wipe(text.get(), form.size());
  return true;
}

// The reverse, of a password that the file held.
bool from_file_form(std::string& password) {
  if (password.find('\0') != std::string::npos) return false;
  if (local_code_page_is_utf8()) return true;
  char* converted = nullptr;
  std::size_t length = 0;
  const int code = xlate_localcp_to_utf8(password.c_str(), &converted, &length);
  const MallocText text(converted);
  if (code == result::no_memory) throw std::bad_alloc();
  if (code != 0) return false;
  cfg::wipe(password);
  password = text.get();
  cfg::wipe(text.get(), password.size());
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

void digest_password(IdentityRecord& record) {
  const std::string& stored = record.stored_password;
  if (EVP_Digest(stored.data(), stored.size(), record.identity.password_digest.data(), nullptr,
                 EVP_sha256(), nullptr) != 1) {
    throw std::bad_alloc();
  }
}

bool same_grant(const Identity& a, const Identity& b) noexcept {
  return a.entry_dn == b.entry_dn && a.bound_dn == b.bound_dn && a.authority == b.authority &&
         a.roles == b.roles && a.password_digest == b.password_digest;
}

}  // namespace

struct Identities::Data {
  cfg::KeyPtr key;
  std::vector<IdentityRecord> records;
  std::unordered_map<std::string_view, const IdentityRecord*> by_dn;  // null: claimed twice
  // Subjects of certificates, to normal bind DNs; "": mapped twice.
  std::unordered_map<std::string, std::string> by_subject;
  // By the further names; null: claimed twice.
  std::unordered_map<std::string, const IdentityRecord*> by_user;
  std::unordered_map<std::string, const IdentityRecord*> by_principal;
  const IdentityRecord* readable = nullptr;   // somebody who can bind by user name; null: nobody
  bool has_principals = false;                // somebody can bind by Kerberos
  const IdentityRecord* costliest = nullptr;  // null: nobody has a password
  std::uint64_t highest_cost = 0;

  ~Data() {
    for (IdentityRecord& record : records) cfg::wipe(record.stored_password);
  }

  void index(std::vector<std::string>& warnings) {
    for (IdentityRecord& record : records) {
      digest_password(record);
      remember_cost(record);
      const auto [place, fresh] = by_dn.try_emplace(record.identity.bound_dn, &record);
      if (fresh) continue;
      place->second = nullptr;
      warnings.push_back(record.identity.entry_dn +
                         ": another entry has the same bind DN, nobody can bind with it");
    }
  }

  using ByName = std::unordered_map<std::string, const IdentityRecord*>;

  void index_names(std::vector<std::string>& warnings) {
    for (const IdentityRecord& record : records) {
      claim(by_user, record.user_name, record, "orv-slapdDigestAdminUser", warnings);
      claim(by_principal, record.principal, record, "orv-slapdKrbAdminDN", warnings);
    }
    for (const auto& [name, record] : by_user)
      if (record != nullptr && can_bind(*record) && is_readable(*record)) readable = record;
    for (const auto& [name, record] : by_principal)
      if (record != nullptr && can_bind(*record)) has_principals = true;
  }

  static void claim(ByName& names, const std::string& name, const IdentityRecord& record,
                    const char* type, std::vector<std::string>& warnings) {
    if (name.empty()) return;
    const auto [place, fresh] = names.try_emplace(name, &record);
    if (fresh) return;
    place->second = nullptr;
    warnings.push_back(record.identity.entry_dn + ": another entry has the same " + type +
                       ", nobody can bind with it");
  }

  const IdentityRecord* find_named(const ByName& names, const std::string& name) const noexcept {
    const auto place = names.find(name);
    if (place == names.end() || place->second == nullptr) return nullptr;
    return can_bind(*place->second) ? place->second : nullptr;
  }

  bool can_bind(const IdentityRecord& record) const noexcept {
    return find_bindable(record.identity.bound_dn) == &record;
  }

  bool is_readable(const IdentityRecord& record) const {
    Secret clear;
    return read_password(record, clear.text);
  }

  // The password in clear, in UTF-8; false when it is stored in a way that cannot be read back, or
  // matches nothing. `clear` may hold something then, too.
  bool read_password(const IdentityRecord& record, std::string& clear) const {
    const std::string& stored = record.stored_password;
    const cfg::OpenResult opened = cfg::open_secret(key.get(), stored, clear);
    if (opened == cfg::OpenResult::broken) return false;
    if (opened == cfg::OpenResult::not_sealed) {
      if (cfg::names_scheme(stored)) return false;
      clear = stored;
    }
    return proves(record, clear, cfg::verify_secret) && from_file_form(clear);
  }

  // The work of reading a password, where there is none to be read.
  void read_any_password() const {
    Secret clear;
    if (readable != nullptr) read_password(*readable, clear.text);
  }

  void map_certificates(std::vector<CertificateMapping>& mappings,
                        std::vector<std::string>& warnings) {
    for (CertificateMapping& mapping : mappings) {
      if (find_bindable(mapping.bound_dn) == nullptr)
        warnings.push_back(std::string(kCertificateMap) + ": nobody can bind as " +
                           mapping.bound_dn);
      const auto [place, fresh] = by_subject.try_emplace(mapping.subject, mapping.bound_dn);
      if (fresh) continue;
      place->second.clear();
      warnings.push_back(std::string(kCertificateMap) + ": " + mapping.subject +
                         " is mapped twice, nobody can bind with it");
    }
  }

  const IdentityRecord* find_mapped(const std::string& subject) const noexcept {
    const auto place = by_subject.find(subject);
    return place == by_subject.end() ? nullptr : find_bindable(place->second);
  }

  void remember_cost(const IdentityRecord& record) {
    if (record.stored_password.empty()) return;
    const std::uint64_t cost = cfg::verification_cost(record.stored_password);
    if (costliest != nullptr && cost <= highest_cost) return;
    costliest = &record;
    highest_cost = cost;
  }

  const IdentityRecord* find(std::string_view name) const {
    std::string normal;
    const int code = cfg::normalize_dn(name, normal);
    if (code == result::no_memory) throw std::bad_alloc();
    if (code != 0 || !may_be_bound(normal)) return nullptr;
    const IdentityRecord* const record = find_bindable(normal);
    return record != nullptr && !record->stored_password.empty() ? record : nullptr;
  }

  // Somebody who may bind, whether with a password or otherwise.
  const IdentityRecord* find_bindable(std::string_view normal) const noexcept {
    const auto place = by_dn.find(normal);
    if (place == by_dn.end() || place->second == nullptr) return nullptr;
    return place->second->enabled ? place->second : nullptr;
  }

  const Identity* authenticate(std::string_view name, std::string_view password,
                               Verify verify) const {
    Secret form;
    const bool possible = to_file_form(password, form.text);
    const IdentityRecord* record = possible ? find(name) : nullptr;
    if (record != nullptr && proves(*record, form.text, verify)) return &record->identity;
    if (record == nullptr ||
        (highest_cost > 0 && cfg::verification_cost(record->stored_password) == 0)) {
      spend_highest_cost(password, verify);
    }
    return nullptr;
  }

  bool proves(const IdentityRecord& record, std::string_view password, Verify verify) const {
    const cfg::SecretPlace place{record.password_type, record.identity.entry_dn};
    return verify(key.get(), place, record.stored_password, password);
  }

  void spend_highest_cost(std::string_view password, Verify verify) const {
    if (costliest == nullptr) return cfg::verify_nothing(password);
    // Whatever the answer is, it proves nothing.
    static_cast<void>(proves(*costliest, password, verify));
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
    identities->data_->index_names(warnings);
    identities->data_->map_certificates(read.certificates, warnings);
    return identities;
  } catch (...) {
    error.assign("out of memory");
    return nullptr;
  }
}

const Identity* Identities::authenticate(std::string_view name, std::string_view password,
                                         Verify verify) const {
  // RFC 4513, 5.1.2: a name without a password proves nothing, and takes no verification to see.
  if (password.empty()) return nullptr;
  return data_->authenticate(name, password, verify);
}

const Identity* Identities::primary_administrator() const noexcept {
  for (const IdentityRecord& record : data_->records)
    if (record.identity.authority == authority::primary_administrator)
      return data_->find_bindable(record.identity.bound_dn) == &record ? &record.identity : nullptr;
  return nullptr;
}

std::shared_ptr<const Identity> Identities::of_certificate(std::string_view subject) const {
  std::string own(subject);
  const IdentityRecord* const record = data_->find_mapped(own);
  if (record == nullptr) return nullptr;
  auto identity = std::make_shared<Identity>(record->identity);
  identity->certificate_subject = std::move(own);
  return identity;
}

std::shared_ptr<const Identity> Identities::of_user(std::string_view name, std::string& password,
                                                    std::string& unreadable) const {
  std::string own(name);
  const IdentityRecord* const record = data_->find_named(data_->by_user, own);
  Secret clear;
  if (record == nullptr || !data_->read_password(*record, clear.text)) {
    if (record != nullptr) unreadable = record->identity.entry_dn;
    data_->read_any_password();
    return nullptr;
  }
  auto identity = std::make_shared<Identity>(record->identity);
  identity->user_name = std::move(own);
  password = clear.text;
  return identity;
}

std::shared_ptr<const Identity> Identities::of_principal(std::string_view principal) const {
  std::string lower = lower_principal(principal);
  const IdentityRecord* const record = data_->find_named(data_->by_principal, lower);
  if (record == nullptr) return nullptr;
  auto identity = std::make_shared<Identity>(record->identity);
  identity->principal = std::move(lower);
  return identity;
}

bool Identities::has_users() const noexcept {
  return data_->readable != nullptr;
}

bool Identities::has_principals() const noexcept {
  return data_->has_principals;
}

bool Identities::maps_certificates() const noexcept {
  return std::any_of(data_->by_subject.begin(), data_->by_subject.end(), [this](const auto& one) {
    return data_->find_bindable(one.second) != nullptr;
  });
}

bool Identities::still_valid(const Identity& bound) const noexcept {
  const Data& data = *data_;
  const IdentityRecord* const record = data.find_bindable(bound.bound_dn);
  if (record == nullptr || !same_grant(record->identity, bound)) return false;
  if (!bound.certificate_subject.empty() && data.find_mapped(bound.certificate_subject) != record)
    return false;
  if (!bound.user_name.empty() && data.find_named(data.by_user, bound.user_name) != record)
    return false;
  return bound.principal.empty() || data.find_named(data.by_principal, bound.principal) == record;
}

bool Identities::claimed_twice(std::string_view name) const {
  std::string normal;
  const int code = cfg::normalize_dn(name, normal);
  if (code == result::no_memory) throw std::bad_alloc();
  const auto place = code == 0 ? data_->by_dn.find(normal) : data_->by_dn.end();
  return place != data_->by_dn.end() && place->second == nullptr;
}

bool Identities::defined_by(std::string_view entry_dn) const noexcept {
  const auto& records = data_->records;
  return std::any_of(records.begin(), records.end(), [&](const IdentityRecord& record) {
    return record.identity.entry_dn == entry_dn;
  });
}

}  // namespace orv::server
