// Code signatures and the entitlements they carry (docs/code-signing.md).
//
// A signature binds one executable (its SHA-256) to an identifier and an entitlements dictionary,
// signed with an ed25519 key. A bundle keeps its executable's signature in Signature.plist at
// its root; an executable outside any bundle keeps a detached one beside
// it, "<executable>.axsig". Only keys installed in the trust directory (<root>/etc/corvane/trust.d,
// root-owned on a real system) are trusted.
//
// Entitlements come only from a signature that verifies against a trusted key and matches the
// executable as it is now: unsigned code, an untrusted signer, a changed executable or changed
// entitlements all give none, with one log line saying why. Results are cached by the identity of
// the executable and its signature file (device, inode, size, modification time), so a second look
// at unchanged files costs no hashing.
//
// Thread-safety: every function and class here is safe to use from any thread.
#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/rpx/Rpx.h"
#include "platform/value/Value.h"

namespace corvane::codesign {

struct Verification {
    bool valid = false;
    std::string identifier;
    std::string signer;  // the signing key, hexadecimal
    Value entitlements;  // a dictionary; empty unless valid
    std::string reason;  // why not valid
};

// The verification of an executable: its bundle's signature when a bundle names it as its
// executable, else its detached signature.
Verification verifyExecutable(const std::string& path);
// The verification of a bundle's executable, or of its contents when it has none.
Verification verifyBundle(const std::string& bundlePath);
// The same for a bundle at a canonical path whose Info.plist the caller has read (`info`).
Verification verifyBundle(const std::string& canonicalPath, const Value& info);
// The verified entitlements (a dictionary, empty when there are none).
Value entitlementsOfExecutable(const std::string& path);
Value entitlementsOfBundle(const std::string& bundlePath);
Value entitlementsOfBundle(const std::string& canonicalPath, const Value& info);

// Why code its signature does not cover may run in the process `pid` (whose executable is the file
// `exe`), or nothing: it was started with LD_PRELOAD, LD_LIBRARY_PATH or LD_AUDIT, or it has an
// executable mapping that is anonymous, deleted, or a file that is neither the executable itself,
// nor owned by root in a directory owned by root (neither writable by anyone else), nor signed by a
// trusted key.
std::optional<std::string> untrustedCodeIn(pid_t pid, const struct stat& exe);

// The code-signing identity of a process, made from the audit token of a connection. The process
// must still be the one the token names (its pidfd, start time and executable file), and run no code
// but what its signature covers and what root installed (untrustedCodeIn), or it has no
// entitlements; the log says which mapping. Made once per connection.
class Handle {
public:
    static std::shared_ptr<Handle> fromAuditToken(const rpx::AuditToken& token);
    // The value of one entitlement, or null.
    Value valueForEntitlement(const std::string& name) const;
    const Verification& verification() const { return verification_; }

private:
    explicit Handle(Verification v) : verification_(std::move(v)) {}
    const Verification verification_;
};

// ---- keys and signing (the axsign tool)

struct KeyPair {
    Bytes publicKey;  // 32 bytes
    Bytes secretKey;  // 64 bytes
};

KeyPair generateKey();
// Writes KEY (secret, mode 0600) and KEY.pub.
Status writeKeyPair(const std::string& path, const KeyPair& keys);
Result<KeyPair> readSecretKey(const std::string& path);
Result<Bytes> readPublicKey(const std::string& path);
std::string trustDirectory();
// Removes a public key from the trust directory; false when it was not there.
Result<bool> untrustKey(const std::string& publicKeyPath);
// Installs a public key file in the trust directory.
Status trustKey(const std::string& publicKeyPath);

// Where a bare executable's signature is written: beside it ("<executable>.axsig"), or in the
// machine's store (<root>/var/lib/corvane/signatures), for programs a package installed, whose
// directory belongs to the package. A signature verifies wherever it lies: only a trusted key
// makes one, so the store needs no protection of its own.
enum class Placement { Beside, Machine };

// Signs a bundle (its executable, or its contents when it has no executable, as a data plug-in) or a
// bare executable. Without an identifier, the bundle's KFBundleIdentifier or the executable's file
// name is used.
Status sign(const std::string& path, const KeyPair& keys, std::optional<std::string> identifier,
            const Value& entitlements, Placement placement = Placement::Beside);

// Where the signature of `path` (a bundle or an executable) lives: a bundle's Signature.plist; for a
// bare executable, the detached signature beside it, else the one in the machine's store.
std::string signaturePath(const std::string& path);
std::string machineSignatureDirectory();
// The machine store's file for an executable: its canonical path with "/" and "%" escaped.
std::string machineSignaturePath(const std::string& executable);

// ---- the signature file, for the fuzz target and tools

struct SignatureFile {
    std::string identifier;
    // What the hash covers: the executable file, or (for a bundle without executable) the bundle's
    // contents: every file, link and directory under it but the signature itself.
    enum class Covers { Executable, Contents } covers = Covers::Executable;
    Bytes hash;               // SHA-256
    Bytes entitlementsBytes;  // an XML property list
    Bytes signer;             // ed25519 public key
    Bytes signature;          // ed25519 signature
};
std::optional<SignatureFile> parseSignature(std::string_view bytes);
// Whether the signature is the signer's over the rest (trust is not looked at).
bool signatureVerifies(const SignatureFile& file);

}  // namespace corvane::codesign
