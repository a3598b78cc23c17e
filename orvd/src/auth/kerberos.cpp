#include "auth/kerberos.h"

#include <dlfcn.h>
#include <gssapi/gssapi.h>
#include <gssapi/gssapi_ext.h>
#include <gssapi/gssapi_krb5.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <new>
#include <string_view>

#include "cfg/secret.h"
#include "slapi/file_trust.h"

// The Kerberos library gives back what it has decrypted for a security layer as it is, and takes no
// other functions for its memory. The plug-in of the SASL library releases it by this function, of
// which the program's own is found first.
extern "C" __attribute__((visibility("default"))) OM_uint32 gss_release_buffer(
    OM_uint32* minor, gss_buffer_t buffer) {
  static const auto release =
      reinterpret_cast<decltype(&gss_release_buffer)>(dlsym(RTLD_NEXT, "gss_release_buffer"));
  if (buffer != nullptr && buffer->value != nullptr) orv::cfg::wipe(buffer->value, buffer->length);
  return release(minor, buffer);
}

namespace orv::server {
namespace {

constexpr const char* kService = "ldap";

class Name {
 public:
  Name() = default;
  ~Name() {
    OM_uint32 minor = 0;
    gss_release_name(&minor, &name);
  }
  Name(const Name&) = delete;
  Name& operator=(const Name&) = delete;
  gss_name_t name = GSS_C_NO_NAME;
};

class Buffer {
 public:
  Buffer() = default;
  ~Buffer() {
    OM_uint32 minor = 0;
    gss_release_buffer(&minor, &buffer);
  }
  Buffer(const Buffer&) = delete;
  Buffer& operator=(const Buffer&) = delete;
  std::string_view text() const noexcept {
    return {static_cast<const char*>(buffer.value), buffer.length};
  }
  gss_buffer_desc buffer = GSS_C_EMPTY_BUFFER;
};

// In words; of the mechanism where it has some.
std::string describe(OM_uint32 major, OM_uint32 minor) {
  OM_uint32 status = 0;
  OM_uint32 more = 0;
  Buffer text;
  if (minor != 0)
    gss_display_status(&status, minor, GSS_C_MECH_CODE, gss_mech_krb5, &more, &text.buffer);
  else
    gss_display_status(&status, major, GSS_C_GSS_CODE, GSS_C_NO_OID, &more, &text.buffer);
  return std::string(text.text());
}

bool may_be_used(const std::string& keytab, std::string& error) {
  struct stat status {};
  if (stat(keytab.c_str(), &status) != 0) {
    error = keytab + ": " + std::strerror(errno);
  } else if (!S_ISREG(status.st_mode)) {
    error = keytab + ": not a regular file";
  } else if ((status.st_mode & (S_IRWXO | S_IWGRP)) != 0) {
    error =
        keytab + ": others may read the keys, or change them; take these rights away (chmod 600)";
  } else {
    // In a folder of others it could be replaced by one whose keys they know.
    error = distrust_of_authority(keytab, geteuid());
    return error.empty();
  }
  return false;
}

gss_cred_id_t acquire(const std::string& keytab, std::string& error) {
  OM_uint32 minor = 0;
  gss_buffer_desc service{std::strlen(kService), const_cast<char*>(kService)};
  Name name;
  OM_uint32 major = gss_import_name(&minor, &service, GSS_C_NT_HOSTBASED_SERVICE, &name.name);
  gss_cred_id_t credentials = GSS_C_NO_CREDENTIAL;
  if (!GSS_ERROR(major)) {
    const std::string place = "FILE:" + keytab;
    gss_key_value_element_desc element{"keytab", place.c_str()};
    const gss_key_value_set_desc store{1, &element};
    gss_OID_set_desc kerberos{1, const_cast<gss_OID>(gss_mech_krb5)};
    major = gss_acquire_cred_from(&minor, name.name, GSS_C_INDEFINITE, &kerberos, GSS_C_ACCEPT,
                                  &store, &credentials, nullptr, nullptr);
  }
  if (!GSS_ERROR(major)) return credentials;
  error = keytab + ": no key of a service ldap/HOST can be used: " + describe(major, minor);
  return GSS_C_NO_CREDENTIAL;
}

}  // namespace

std::shared_ptr<const KerberosAcceptor> KerberosAcceptor::open(const std::string& keytab,
                                                               std::string& error) {
  if (!may_be_used(keytab, error)) return nullptr;
  std::shared_ptr<KerberosAcceptor> acceptor(new KerberosAcceptor);
  acceptor->credentials_ = acquire(keytab, error);
  if (acceptor->credentials_ == nullptr) return nullptr;
  return acceptor;
}

KerberosAcceptor::~KerberosAcceptor() {
  auto* credentials = static_cast<gss_cred_id_t>(credentials_);
  OM_uint32 minor = 0;
  gss_release_cred(&minor, &credentials);
}

std::string full_principal(const std::string& name) {
  OM_uint32 minor = 0;
  Name given;
  Name whole;
  Buffer text;
  gss_buffer_desc spelled{name.size(), const_cast<char*>(name.data())};
  if (GSS_ERROR(gss_import_name(&minor, &spelled, GSS_C_NT_USER_NAME, &given.name)) ||
      GSS_ERROR(gss_canonicalize_name(&minor, given.name, const_cast<gss_OID>(gss_mech_krb5),
                                      &whole.name)) ||
      GSS_ERROR(gss_display_name(&minor, whole.name, &text.buffer, nullptr)))
    return "";
  return std::string(text.text());
}

bool has_foreign_gssapi() noexcept {
  void* const other = dlopen("libgssapi.so.3", RTLD_NOW | RTLD_NOLOAD);
  if (other == nullptr) return false;
  dlclose(other);
  return true;
}

}  // namespace orv::server
