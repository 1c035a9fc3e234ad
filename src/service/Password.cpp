#include "service/Password.h"

#include <fcntl.h>
#include <sodium.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <cmath>
#include <cstring>
#include <fstream>
#include <limits>
#include <mutex>
#include <optional>
#include <sstream>
#include <system_error>
#include <vector>

#include "service/Errors.h"

namespace kest {

namespace {

// The key file: "key = value" lines, '#' comments.
//   format = 1
//   pepper = <64 hex digits>
//   ops = <Argon2id passes>
//   mem = <bytes>
constexpr std::size_t kMaxKeyFileSize = 4096;
constexpr uint64_t kMaxOps = 64;
constexpr std::size_t kMaxMem = std::size_t{1} << 30;

Error keyFileError(const std::filesystem::path& file, const std::string& why) {
    return Error{err::kKeyFile, "the key file " + file.string() + " " + why};
}

bool sodiumReady() {
    static const bool ready = sodium_init() >= 0;
    return ready;
}

std::string_view trim(std::string_view s) {
    while (!s.empty() && (s.front() == ' ' || s.front() == '\t' || s.front() == '\r'))
        s.remove_prefix(1);
    while (!s.empty() && (s.back() == ' ' || s.back() == '\t' || s.back() == '\r'))
        s.remove_suffix(1);
    return s;
}

std::optional<uint64_t> parseNumber(std::string_view s) {
    uint64_t n = 0;
    auto [end, ec] = std::from_chars(s.data(), s.data() + s.size(), n);
    if (ec != std::errc() || end != s.data() + s.size() || s.empty())
        return std::nullopt;
    return n;
}

int hexDigit(char c) {
    if (c >= '0' && c <= '9')
        return c - '0';
    if (c >= 'a' && c <= 'f')
        return c - 'a' + 10;
    if (c >= 'A' && c <= 'F')
        return c - 'A' + 10;
    return -1;
}

std::string keyFileText(const KeyMaterial& key) {
    char hex[sizeof key.pepper * 2 + 1];
    sodium_bin2hex(hex, sizeof hex, key.pepper.data(), key.pepper.size());
    std::string text =
        "# The password pepper of one data source. Keep this file secret and with a copy in a\n"
        "# safe place: without it no stored password can be checked.\n"
        "format = 1\n";
    text += "pepper = " + std::string(hex) + "\n";
    text += "ops = " + std::to_string(key.opsLimit) + "\n";
    text += "mem = " + std::to_string(key.memLimit) + "\n";
    sodium_memzero(hex, sizeof hex);
    return text;
}

}  // namespace

Result<KeyMaterial> createKeyFile(const std::filesystem::path& file) {
    if (!sodiumReady())
        return Error{err::kInternal, "the cryptography library failed to start"};
    std::error_code ec;
    if (file.has_parent_path()) {
        std::filesystem::create_directories(file.parent_path(), ec);
        if (ec)
            return keyFileError(file, "cannot get its folder: " + ec.message());
    }
    KeyMaterial key;
    randombytes_buf(key.pepper.data(), key.pepper.size());
    std::string text = keyFileText(key);

    // O_EXCL: an existing pepper is never replaced, or every password coded
    // with it would be lost.
    int fd = ::open(file.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
    if (fd < 0) {
        int e = errno;
        sodium_memzero(text.data(), text.size());
        if (e == EEXIST)
            return keyFileError(file, "already exists; it is never overwritten");
        return keyFileError(file, std::string("cannot be created: ") + std::strerror(e));
    }
    bool good = ::fchmod(fd, 0600) == 0;
    const char* p = text.data();
    std::size_t left = text.size();
    while (good && left > 0) {
        ssize_t n = ::write(fd, p, left);
        if (n < 0 && errno == EINTR)
            continue;
        if (n <= 0) {
            good = false;
            break;
        }
        p += n;
        left -= static_cast<std::size_t>(n);
    }
    if (good)
        good = ::fsync(fd) == 0;
    std::string why = good ? "" : std::strerror(errno);
    ::close(fd);
    sodium_memzero(text.data(), text.size());
    if (!good) {
        std::filesystem::remove(file, ec);
        return keyFileError(file, "cannot be written: " + why);
    }
    return key;
}

Result<KeyMaterial> loadKeyFile(const std::filesystem::path& file) {
    std::error_code ec;
    if (!std::filesystem::is_regular_file(file, ec))
        return keyFileError(file, "does not exist or is not a file");
    auto size = std::filesystem::file_size(file, ec);
    if (ec || size > kMaxKeyFileSize)
        return keyFileError(file, "has the wrong size");
    std::ifstream in(file, std::ios::binary);
    if (!in)
        return keyFileError(file, "cannot be read");
    std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());

    KeyMaterial key;
    bool havePepper = false, haveOps = false, haveMem = false, haveFormat = false;
    std::istringstream lines(text);
    std::string raw;
    int number = 0;
    while (std::getline(lines, raw)) {
        ++number;
        std::string_view line = trim(raw);
        if (line.empty() || line.front() == '#')
            continue;
        std::string where = "line " + std::to_string(number) + ": ";
        std::size_t eq = line.find('=');
        if (eq == std::string_view::npos)
            return keyFileError(file, "is malformed at " + where + "expected \"key = value\"");
        std::string_view name = trim(line.substr(0, eq));
        std::string_view value = trim(line.substr(eq + 1));
        if (name == "format") {
            if (haveFormat || value != "1")
                return keyFileError(file, "has an unknown format at " + where);
            haveFormat = true;
        } else if (name == "pepper") {
            if (havePepper || value.size() != key.pepper.size() * 2)
                return keyFileError(file,
                                    "is malformed at " + where + "the pepper needs 64 hex digits");
            for (std::size_t i = 0; i < key.pepper.size(); ++i) {
                int hi = hexDigit(value[2 * i]);
                int lo = hexDigit(value[2 * i + 1]);
                if (hi < 0 || lo < 0)
                    return keyFileError(file, "is malformed at " + where + "the pepper is not hex");
                key.pepper[i] = static_cast<unsigned char>(hi * 16 + lo);
            }
            havePepper = true;
        } else if (name == "ops") {
            auto n = parseNumber(value);
            if (haveOps || !n || *n < crypto_pwhash_OPSLIMIT_MIN || *n > kMaxOps)
                return keyFileError(file, "is malformed at " + where + "ops is out of range");
            key.opsLimit = *n;
            haveOps = true;
        } else if (name == "mem") {
            auto n = parseNumber(value);
            if (haveMem || !n || *n < crypto_pwhash_MEMLIMIT_MIN || *n > kMaxMem)
                return keyFileError(file, "is malformed at " + where + "mem is out of range");
            key.memLimit = static_cast<std::size_t>(*n);
            haveMem = true;
        } else {
            return keyFileError(file, "is malformed at " + where + "unknown setting");
        }
    }
    sodium_memzero(text.data(), text.size());
    if (!havePepper || !haveOps || !haveMem)
        return keyFileError(file, "lacks one of the settings pepper, ops and mem");
    return key;
}

std::string normalisePassword(std::string_view password) {
    auto blank = [](char c) { return c == ' ' || c == '\t' || c == '\r' || c == '\n'; };
    while (!password.empty() && blank(password.front()))
        password.remove_prefix(1);
    while (!password.empty() && blank(password.back()))
        password.remove_suffix(1);
    std::string out(password);
    for (char& c : out) {
        if (c >= 'A' && c <= 'Z')
            c = static_cast<char>(c - 'A' + 'a');
    }
    return out;
}

Result<double> passwordCode(const KeyMaterial& key, std::string_view password, Date moment) {
    if (!sodiumReady())
        return Error{err::kInternal, "the cryptography library failed to start"};
    // Ten thousand years either way is far beyond any real change moment.
    if (!std::isfinite(moment.days) || std::fabs(moment.days) > 3.7e6)
        return Error{err::kBadArgument, "the moment of the password change is not a valid date"};
    if (password.size() > 4096)
        return Error{err::kBadArgument, "the password is too long"};

    auto seconds = static_cast<int64_t>(std::llround(moment.days * 86400.0));
    unsigned char material[sizeof key.pepper + 8];
    std::memcpy(material, key.pepper.data(), key.pepper.size());
    auto useconds = static_cast<uint64_t>(seconds);
    for (int i = 0; i < 8; ++i)
        material[key.pepper.size() + static_cast<std::size_t>(i)] =
            static_cast<unsigned char>(useconds >> (8 * i));
    unsigned char digest[crypto_generichash_BYTES];
    crypto_generichash(digest, sizeof digest, material, sizeof material, nullptr, 0);
    sodium_memzero(material, sizeof material);
    static_assert(crypto_pwhash_SALTBYTES == 16);
    unsigned char salt[crypto_pwhash_SALTBYTES];
    std::memcpy(salt, digest, sizeof salt);

    std::string normal = normalisePassword(password);
    unsigned char out[16];
    int rc = crypto_pwhash(out, sizeof out, normal.data(), normal.size(), salt, key.opsLimit,
                           key.memLimit, crypto_pwhash_ALG_ARGON2ID13);
    sodium_memzero(normal.data(), normal.size());
    if (rc != 0)
        return Error{err::kInternal, "coding the password failed (out of memory?)"};
    uint64_t x = 0;
    for (int i = 7; i >= 0; --i)
        x = (x << 8) | out[i];
    sodium_memzero(out, sizeof out);
    constexpr uint64_t kModulus = (uint64_t{1} << 52) - 1;
    return static_cast<double>(x % kModulus + 1);
}

}  // namespace kest
