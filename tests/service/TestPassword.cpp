#include <gtest/gtest.h>
#include <sodium.h>
#include <sys/stat.h>

#include <chrono>
#include <cmath>
#include <cstring>
#include <fstream>
#include <sstream>
#include <string>

#include "service/Errors.h"
#include "service/Password.h"
#include "support/TempDir.h"

namespace kest {
namespace {

std::string slurp(const std::filesystem::path& p) {
    std::ifstream in(p);
    std::stringstream s;
    s << in.rdbuf();
    return s.str();
}

// A cheap cost keeps the many codes of these tests quick; the derivation is
// the same at every cost.
KeyMaterial cheapKey(unsigned char fill = 7) {
    KeyMaterial key;
    key.pepper.fill(fill);
    key.opsLimit = 1;
    key.memLimit = 8192;
    return key;
}

double code(const KeyMaterial& key, std::string_view password, double moment) {
    auto c = passwordCode(key, password, Date{moment});
    EXPECT_TRUE(c.ok()) << c.error().description;
    return c.ok() ? c.value() : -1;
}

TEST(KeyFile, IsCreatedPrivateAndLoadsBack) {
    test::TempDir dir;
    auto file = dir.path() / "sub" / "demo.key";
    auto created = createKeyFile(file);
    ASSERT_TRUE(created.ok()) << created.error().description;
    struct stat st {};
    ASSERT_EQ(stat(file.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0600u);

    auto loaded = loadKeyFile(file);
    ASSERT_TRUE(loaded.ok()) << loaded.error().description;
    EXPECT_EQ(loaded.value().pepper, created.value().pepper);
    EXPECT_EQ(loaded.value().opsLimit, created.value().opsLimit);
    EXPECT_EQ(loaded.value().memLimit, created.value().memLimit);
    EXPECT_NE(created.value().pepper, KeyMaterial{}.pepper) << "the pepper is random";
}

TEST(KeyFile, NeverOverwritesAnExistingFile) {
    test::TempDir dir;
    auto file = dir.path() / "demo.key";
    ASSERT_TRUE(createKeyFile(file).ok());
    std::string before = slurp(file);
    auto again = createKeyFile(file);
    ASSERT_FALSE(again.ok());
    EXPECT_EQ(again.error().number, err::kKeyFile);
    EXPECT_EQ(slurp(file), before);
}

TEST(KeyFile, MalformedFilesAreRefused) {
    test::TempDir dir;
    const std::string pepper(64, 'a');
    const std::string good = "pepper = " + pepper + "\nops = 2\nmem = 16777216\n";
    auto file = dir.path() / "k.key";
    std::ofstream(file) << good;
    ASSERT_TRUE(loadKeyFile(file).ok());

    const std::string bad[] = {
        "",
        "pepper = " + pepper.substr(2) + "\nops = 2\nmem = 16777216\n",
        "pepper = " + pepper + "aa\nops = 2\nmem = 16777216\n",
        "pepper = " + pepper.substr(1) + "g\nops = 2\nmem = 16777216\n",
        "pepper = " + pepper + "\nops = 0\nmem = 16777216\n",
        "pepper = " + pepper + "\nops = two\nmem = 16777216\n",
        "pepper = " + pepper + "\nops = 2\nmem = 100\n",
        "pepper = " + pepper + "\nops = 2\nmem = 16777216x\n",
        "pepper = " + pepper + "\nops = 2\n",
        good + "ops = 3\n",
        good + "colour = blue\n",
        good + "format = 9\n",
        "garbage\n" + good,
    };
    for (const std::string& text : bad) {
        std::ofstream(file, std::ios::trunc) << text;
        auto loaded = loadKeyFile(file);
        ASSERT_FALSE(loaded.ok()) << text;
        EXPECT_EQ(loaded.error().number, err::kKeyFile);
    }
    EXPECT_EQ(loadKeyFile(dir.path() / "missing.key").error().number, err::kKeyFile);
    EXPECT_EQ(loadKeyFile(dir.path()).error().number, err::kKeyFile);
}

TEST(PasswordNormalising, TrimsAndLowerCases) {
    EXPECT_EQ(normalisePassword("  Secret \t"), "secret");
    EXPECT_EQ(normalisePassword("MiXeD 123"), "mixed 123");
    EXPECT_EQ(normalisePassword("   "), "");
}

TEST(PasswordCoding, IsAWholeNumberInRangeAndDeterministic) {
    KeyMaterial key = cheapKey();
    for (int i = 0; i < 8; ++i) {
        double c = code(key, "pw" + std::to_string(i), 45000.5 + i);
        EXPECT_GE(c, 1.0);
        EXPECT_LT(c, std::ldexp(1.0, 52));
        EXPECT_EQ(c, std::floor(c));
        EXPECT_EQ(c, code(key, "pw" + std::to_string(i), 45000.5 + i));
    }
}

TEST(PasswordCoding, DependsOnPepperMomentAndPassword) {
    KeyMaterial key = cheapKey();
    const double base = code(key, "secret", 45000.5);
    EXPECT_NE(base, code(cheapKey(8), "secret", 45000.5));
    EXPECT_NE(base, code(key, "secret", 45000.5 + 1.0 / 86400));
    EXPECT_NE(base, code(key, "secret2", 45000.5));
    KeyMaterial costly = key;
    costly.opsLimit = 2;
    EXPECT_NE(base, code(costly, "secret", 45000.5));
}

TEST(PasswordCoding, NormalisesThePasswordAndRoundsTheMoment) {
    KeyMaterial key = cheapKey();
    const double second = 45000.0 + 43200.0 / 86400;  // noon
    const double base = code(key, "secret", second);
    EXPECT_EQ(base, code(key, " Secret ", second));
    EXPECT_EQ(base, code(key, "SECRET", second));
    // 0.2 s before and 0.1 s after the same second.
    EXPECT_EQ(base, code(key, "secret", second - 0.2 / 86400));
    EXPECT_EQ(base, code(key, "secret", second + 0.1 / 86400));
}

TEST(PasswordCoding, RefusesMomentsThatAreNoDates) {
    KeyMaterial key = cheapKey();
    for (double bad : {std::nan(""), HUGE_VAL, 1e300}) {
        auto c = passwordCode(key, "x", Date{bad});
        ASSERT_FALSE(c.ok());
        EXPECT_EQ(c.error().number, err::kBadArgument);
    }
}

// The derivation written out step by step, so that a change to it (which
// would lock every user out) cannot pass unnoticed.
TEST(PasswordCoding, FollowsTheDocumentedDerivation) {
    ASSERT_GE(sodium_init(), 0);
    KeyMaterial key = cheapKey(3);
    const int64_t seconds = 45123LL * 86400 + 3661;
    unsigned char material[40];
    std::memcpy(material, key.pepper.data(), 32);
    for (int i = 0; i < 8; ++i)
        material[32 + i] = static_cast<unsigned char>(static_cast<uint64_t>(seconds) >> (8 * i));
    unsigned char digest[crypto_generichash_BYTES];
    crypto_generichash(digest, sizeof digest, material, sizeof material, nullptr, 0);
    unsigned char out[16];
    ASSERT_EQ(crypto_pwhash(out, sizeof out, "secret", 6, digest, key.opsLimit, key.memLimit,
                            crypto_pwhash_ALG_ARGON2ID13),
              0);
    uint64_t x = 0;
    for (int i = 7; i >= 0; --i)
        x = (x << 8) | out[i];
    const double expected = static_cast<double>(x % ((uint64_t{1} << 52) - 1) + 1);
    EXPECT_EQ(code(key, " SeCret", static_cast<double>(seconds) / 86400), expected);
}

TEST(PasswordCoding, DefaultCostStaysQuick) {
    KeyMaterial key;
    key.pepper.fill(1);
    auto start = std::chrono::steady_clock::now();
    EXPECT_GT(code(key, "secret", 45000.0), 0);
    auto took = std::chrono::steady_clock::now() - start;
    EXPECT_LT(took, std::chrono::milliseconds(200));
}

}  // namespace
}  // namespace kest
