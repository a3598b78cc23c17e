// RAII owners for objects of OpenSSL.
#pragma once

#include <openssl/bio.h>
#include <openssl/evp.h>
#include <openssl/x509.h>

#include <memory>

namespace orv {

// For those who own objects of further types: `std::unique_ptr<SSL_CTX, Releaser<SSL_CTX_free>>`.
template <auto Release>
struct Releaser {
  template <typename T>
  void operator()(T* object) const noexcept {
    Release(object);
  }
};

using Bio = std::unique_ptr<BIO, Releaser<BIO_free>>;  // one alone, in no chain
using Certificate = std::unique_ptr<X509, Releaser<X509_free>>;
using PrivateKey = std::unique_ptr<EVP_PKEY, Releaser<EVP_PKEY_free>>;

}  // namespace orv
