// What the certificate and key handles of cert_trust.h hold on Linux.
#pragma once

#include "platform/cert_trust.h"
#include "platform/linux/openssl_handles.h"

namespace brisvale::certtrust {

struct Certificate::Impl {
  openssl::X509Ptr x509;
};

struct PublicKey::Impl {
  openssl::PkeyPtr key;
};

}  // namespace brisvale::certtrust
