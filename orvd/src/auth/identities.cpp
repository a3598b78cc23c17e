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

bool Identities::still_valid(const Identity& bound) const noexcept {
  const IdentityRecord* const record = data_->find_bindable(bound.bound_dn);
  if (record == nullptr || !same_grant(record->identity, bound)) return false;
  return bound.certificate_subject.empty() ||
         data_->find_mapped(bound.certificate_subject) == record;
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
