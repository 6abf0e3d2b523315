// The server's RSA key pair for encrypted parameters (not installed).
//
// Files, under the system root:
//   /var/lib/vela/keys/                   directory, mode 0700
//   /var/lib/vela/keys/param_rsa.pem      private key, PKCS#8 PEM
//                                         ("BEGIN PRIVATE KEY"), unencrypted,
//                                         mode 0600
//   /var/lib/vela/keys/param_rsa.pub.pem  public key, SubjectPublicKeyInfo
//                                         PEM ("BEGIN PUBLIC KEY"), mode 0644
//   /var/lib/vela/keys/.lock              creation lock (flock), mode 0600
//
// The pair is made when the public key is first asked for (decryption only
// ever loads it): 3072-bit RSA, public exponent 65537. The first process to
// need it takes the creation lock, checks again that no other process made
// the pair meanwhile, generates it, and publishes each file atomically (temporary file, fsync, rename; the public key first, the
// private key last, then fsync of the directory). The private key file is
// what marks a complete pair, and it is never overwritten: a private key
// that exists but cannot be used (unreadable, not PEM, not RSA, weaker than
// 2048 bits, readable by group or others, not owned by the process's
// user, a symbolic link) makes every call fail until an administrator
// removes or repairs it. A key put in place by an administrator (RSA of
// 2048 bits or more, unencrypted PEM, mode 0600) is used as it is; the
// public key file is brought in line with it the next time the public key
// is asked for.
#pragma once

#include <string>

#include "session/LazyCrypto.h"

namespace VELA {
namespace Session {

// A new reference to the server's private key (free it with
// api.EVP_PKEY_free), loaded on first use and cached for the process (per
// system root). With `create` the pair is made when there is none yet;
// without, a missing pair is a failure and nothing is written: decryption
// never creates a key, since no client can have encrypted anything before
// it fetched the public key, and a forged ciphertext must not be able to
// make the server generate one. Null on failure, logged. Thread-safe.
EVP_PKEY* AcquireServerKey(const CryptoApi& api, bool create);

// The public half of `key` as SubjectPublicKeyInfo PEM. False on failure,
// logged; `pem` is unchanged then.
bool PublicKeyPEM(const CryptoApi& api, EVP_PKEY* key, std::string& pem);

// Makes the public key file hold `pem` (the public half of the private key
// in use) when it is missing or differs, for instance after an
// administrator put a key pair in place. Failures are logged only: the
// file is a copy for people and tools, the private key is what counts.
void RefreshPublicKeyFile(const std::string& pem);

}  // namespace Session
}  // namespace VELA
