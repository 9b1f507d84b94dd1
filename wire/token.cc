// Token format.
//
//   token     = "drx1" ";" class ";" path-hex ";" mac-hex
//   class     = 1*64( ALPHA / DIGIT / "." / "-" / "_" )
//   path-hex  = 2*( 2LHEX )        ; the path's bytes, an absolute path without NUL
//   mac-hex   = 64LHEX             ; HMAC-SHA256 of mac-input under the key
//   LHEX      = DIGIT / "a"-"f"    ; lower case only: one grant, one spelling
//   mac-input = "drx1" %x00 class %x00 path
//
// Two processes may make the key at once: each writes a complete temporary
// file and link()s it to the key's name, which fails for all but the first;
// everyone then reads the file that won.
//
// Rejected: carrying the path as plain text (a path may hold ';' or bytes
// that are not printable) and base64 (hex keeps the token free of '/' and
// '+', which shells and URLs treat specially).
#include "wire/token.h"

#include <fcntl.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <mutex>

namespace dr::token {
namespace {

constexpr std::string_view kTokenMagic = "drx1";
constexpr char kTokenSeparator = ';';
constexpr size_t kMaxClassLength = 64;
constexpr size_t kMacBytes = crypto_auth_hmacsha256_BYTES;
// Longer than any path the kernel accepts, twice (hex), plus the rest.
constexpr size_t kMaxTokenLength = 2 * PATH_MAX + kMaxClassLength + 2 * kMacBytes + 16;

static_assert(kKeyBytes == crypto_auth_hmacsha256_KEYBYTES && kMacBytes == 32);

using Mac = std::array<uint8_t, kMacBytes>;

void InitSodium() {
  static std::once_flag once;
  std::call_once(once, [] {
    if (sodium_init() < 0) std::abort();  // no usable random source: nothing can be signed
  });
}

// Writes the lower-case hex of `n` bytes at `out` (2n characters). Tokens
// carry paths in hex, so this runs for every byte of every path granted.
char* WriteHex(char* out, const uint8_t* bytes, size_t n) {
  static constexpr char kDigits[] = "0123456789abcdef";
  for (size_t i = 0; i < n; ++i) {
    *out++ = kDigits[bytes[i] >> 4];
    *out++ = kDigits[bytes[i] & 0xf];
  }
  return out;
}

std::optional<std::string> Unhex(std::string_view hex) {
  if (hex.size() % 2 != 0) return std::nullopt;
  auto digit = [](char c) -> int {
    if (c >= '0' && c <= '9') return c - '0';
    if (c >= 'a' && c <= 'f') return c - 'a' + 10;
    return -1;
  };
  std::string out;
  out.reserve(hex.size() / 2);
  for (size_t i = 0; i < hex.size(); i += 2) {
    int hi = digit(hex[i]), lo = digit(hex[i + 1]);
    if (hi < 0 || lo < 0) return std::nullopt;
    out += static_cast<char>(hi << 4 | lo);
  }
  return out;
}

crypto_auth_hmacsha256_state Keyed(const Key& key) {
  InitSodium();
  crypto_auth_hmacsha256_state state;
  crypto_auth_hmacsha256_init(&state, key.data(), key.size());
  return state;
}

// The MAC of a token, from the HMAC state already keyed with the key.
// mac-input is fed in its pieces rather than copied together first.
Mac MacOf(const crypto_auth_hmacsha256_state& keyed, std::string_view cls, std::string_view path) {
  static constexpr unsigned char kNul = 0;
  auto update = [](crypto_auth_hmacsha256_state& state, std::string_view bytes) {
    crypto_auth_hmacsha256_update(&state, reinterpret_cast<const unsigned char*>(bytes.data()),
                                  bytes.size());
  };
  crypto_auth_hmacsha256_state state = keyed;
  update(state, kTokenMagic);
  crypto_auth_hmacsha256_update(&state, &kNul, 1);
  update(state, cls);
  crypto_auth_hmacsha256_update(&state, &kNul, 1);
  update(state, path);
  Mac mac;
  crypto_auth_hmacsha256_final(&state, mac.data());
  sodium_memzero(&state, sizeof state);
  return mac;
}

std::string ParentOf(const std::string& path) {
  size_t slash = path.find_last_of('/');
  if (slash == std::string::npos) return ".";
  return slash == 0 ? "/" : path.substr(0, slash);
}

// Makes `dir` and its missing parents (0700) and checks that the folder
// itself is the user's and closed to others' writes.
Status MakeKeyFolder(const std::string& dir) {
  for (size_t pos = 1;; ++pos) {
    pos = dir.find('/', pos);
    std::string part = dir.substr(0, pos);
    if (::mkdir(part.c_str(), 0700) != 0 && errno != EEXIST) {
      return PosixError(errno, "mkdir " + part);
    }
    if (pos == std::string::npos) break;
  }
  struct stat st;
  if (::lstat(dir.c_str(), &st) != 0) return PosixError(errno, "stat " + dir);
  if (!S_ISDIR(st.st_mode) || st.st_uid != ::geteuid() || (st.st_mode & 022) != 0) {
    return PosixError(EPERM, "unsafe key folder " + dir);
  }
  return Status::OK();
}

Error Refused(int64_t code, const char* why) {
  return Error(kSandboxErrorDomain, code, std::string("extension token refused: ") + why);
}

}  // namespace

bool ValidClass(std::string_view c) {
  if (c.empty() || c.size() > kMaxClassLength) return false;
  for (char ch : c) {
    bool ok = (ch >= 'a' && ch <= 'z') || (ch >= 'A' && ch <= 'Z') || (ch >= '0' && ch <= '9') ||
              ch == '.' || ch == '-' || ch == '_';
    if (!ok) return false;
  }
  return true;
}

Result<Key> ReadKey(const std::string& path) {
  int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK);
  if (fd < 0) return PosixError(errno, "open " + path);
  struct stat st;
  if (::fstat(fd, &st) != 0) {
    int e = errno;
    ::close(fd);
    return PosixError(e, "stat " + path);
  }
  if (!S_ISREG(st.st_mode) || st.st_uid != ::geteuid() || (st.st_mode & 077) != 0) {
    ::close(fd);
    return PosixError(EPERM, "unsafe key file " + path);
  }
  Key key;
  ssize_t n;
  do {
    n = ::pread(fd, key.data(), key.size(), 0);
  } while (n < 0 && errno == EINTR);
  int e = errno;
  ::close(fd);
  if (n < 0) return PosixError(e, "read " + path);
  if (static_cast<size_t>(n) != key.size() || st.st_size != static_cast<off_t>(key.size())) {
    return PosixError(EINVAL,
                      "key file " + path + " is not " + std::to_string(kKeyBytes) + " bytes long");
  }
  return key;
}

Result<Key> MakeKey(const std::string& path, const std::optional<Key>& seed) {
  Result<Key> existing = ReadKey(path);
  if (existing.ok() || existing.error().code() != ENOENT) return existing;
  if (Status s = MakeKeyFolder(ParentOf(path)); !s.ok()) return s;

  std::string tmp = path + ".XXXXXX";
  int fd = ::mkostemp(tmp.data(), O_CLOEXEC);
  if (fd < 0) return PosixError(errno, "create " + tmp);
  Key key;
  if (seed) {
    key = *seed;
  } else {
    InitSodium();
    randombytes_buf(key.data(), key.size());
  }
  ssize_t n = ::fchmod(fd, 0600) == 0 ? ::write(fd, key.data(), key.size()) : -1;
  bool written = n == static_cast<ssize_t>(key.size()) && ::fsync(fd) == 0;
  int e = written ? 0 : (n >= 0 ? EIO : errno);
  sodium_memzero(key.data(), key.size());
  if (::close(fd) != 0 && written) {
    written = false;
    e = errno;
  }
  // link() never replaces: the first process to get here wins, and the
  // others drop their temporary and read the winner's key.
  if (written && ::link(tmp.c_str(), path.c_str()) != 0 && errno != EEXIST) {
    written = false;
    e = errno;
  }
  ::unlink(tmp.c_str());
  if (!written) return PosixError(e, "write " + path);
  return ReadKey(path);
}

Signer::Signer(const Key& key) : keyed_(Keyed(key)) {}

Signer::~Signer() { sodium_memzero(&keyed_, sizeof keyed_); }

std::string Signer::issue(std::string_view cls, std::string_view path) const {
  Mac mac = MacOf(keyed_, cls, path);
  // Written in place into a string of the token's final size.
  std::string token(kTokenMagic.size() + cls.size() + 2 * path.size() + 2 * mac.size() + 3,
                    kTokenSeparator);
  char* out = token.data();
  out = std::copy(kTokenMagic.begin(), kTokenMagic.end(), out) + 1;
  out = std::copy(cls.begin(), cls.end(), out) + 1;
  out = WriteHex(out, reinterpret_cast<const uint8_t*>(path.data()), path.size()) + 1;
  WriteHex(out, mac.data(), mac.size());
  return token;
}

Result<std::string> Verify(std::string_view token, const Key& key) {
  if (token.size() > kMaxTokenLength) return Refused(kExtensionMalformed, "too long");
  // Split into exactly four fields.
  std::array<std::string_view, 4> fields;
  size_t start = 0;
  for (size_t i = 0; i < fields.size(); ++i) {
    size_t end = i + 1 < fields.size() ? token.find(kTokenSeparator, start) : token.size();
    if (end == std::string_view::npos) return Refused(kExtensionMalformed, "too few fields");
    fields[i] = token.substr(start, end - start);
    start = end + 1;
  }
  auto [magic, cls, pathHex, macHex] = fields;
  if (magic != kTokenMagic) return Refused(kExtensionMalformed, "not a drd token");
  if (!ValidClass(cls)) return Refused(kExtensionMalformed, "bad class");
  std::optional<std::string> path = Unhex(pathHex);
  std::optional<std::string> mac = Unhex(macHex);
  if (!path || path->empty() || (*path)[0] != '/' || path->find('\0') != std::string::npos) {
    return Refused(kExtensionMalformed, "bad path");
  }
  if (!mac || mac->size() != kMacBytes) return Refused(kExtensionMalformed, "bad signature");

  crypto_auth_hmacsha256_state keyed = Keyed(key);
  Mac expected = MacOf(keyed, cls, *path);
  sodium_memzero(&keyed, sizeof keyed);
  if (sodium_memcmp(expected.data(), mac->data(), kMacBytes) != 0) {
    return Refused(kExtensionForged, "signature does not match");
  }
  if (cls != kReadOnlyFileExtensionClass) return Refused(kExtensionWrongClass, "not read-only");
  return std::move(*path);
}

}  // namespace dr::token
