#include <gtest/gtest.h>

#include <cstdlib>
#include <fstream>
#include <optional>
#include <sstream>
#include <string>

#include "service/DataSources.h"
#include "service/Errors.h"
#include "support/TempDir.h"

namespace kest {
namespace {

class DataSourcesTest : public ::testing::Test {
protected:
    void write(const std::string& text) {
        std::ofstream(dir.path() / std::string(kDataSourcesFile)) << text;
    }
    std::string read() {
        std::ifstream in(dir.path() / std::string(kDataSourcesFile));
        std::stringstream s;
        s << in.rdbuf();
        return s.str();
    }
    test::TempDir dir;
};

TEST_F(DataSourcesTest, ParsesSectionsAndComments) {
    write(
        "# the service's data sources\n"
        "; another comment\n"
        "\n"
        "[Demo]\n"
        "  driver = SQLite \n"
        "database=demo.db\n"
        "KeyFile = /etc/kest/demo.key\r\n"
        "[Test data.2]\n"
        "database = /srv/test.db\n"
        "keyfile = test.key\n");
    auto sources = loadDataSources(dir.path());
    ASSERT_TRUE(sources.ok()) << sources.error().description;
    ASSERT_EQ(sources.value().size(), 2u);
    const DataSourceConfig& demo = sources.value()[0];
    EXPECT_EQ(demo.name, "Demo");
    EXPECT_EQ(demo.driver, "sqlite");
    EXPECT_EQ(demo.database, "demo.db");
    EXPECT_EQ(demo.keyFile, "/etc/kest/demo.key");
    EXPECT_EQ(sources.value()[1].name, "Test data.2");
    EXPECT_EQ(sources.value()[1].driver, "sqlite") << "sqlite is the default driver";

    auto found = findDataSource(dir.path(), "DEMO");
    ASSERT_TRUE(found.ok());
    EXPECT_EQ(found.value().name, "Demo");
    EXPECT_EQ(resolvePath(dir.path(), found.value().database), dir.path() / "demo.db");
    EXPECT_EQ(resolvePath(dir.path(), found.value().keyFile), "/etc/kest/demo.key");
}

TEST_F(DataSourcesTest, UnknownNameIsAnErrorWithOrWithoutAFile) {
    auto none = findDataSource(dir.path(), "Demo");
    ASSERT_FALSE(none.ok());
    EXPECT_EQ(none.error().number, err::kUnknownDataSource);
    EXPECT_NE(none.error().description.find("Demo"), std::string::npos);

    write("[Demo]\ndatabase = demo.db\nkeyfile = demo.key\n");
    auto other = findDataSource(dir.path(), "Demo2");
    ASSERT_FALSE(other.ok());
    EXPECT_EQ(other.error().number, err::kUnknownDataSource);
    EXPECT_FALSE(findDataSource(dir.path(), "Dem").ok());
}

TEST_F(DataSourcesTest, MalformedFilesAreRefused) {
    const char* texts[] = {
        "database = x.db\n",                                        // before any section
        "[Demo\ndatabase = x.db\nkeyfile = x.key\n",                // unclosed header
        "[Demo]\ndatabase x.db\nkeyfile = x.key\n",                 // no '='
        "[Demo]\nkeyfile = x.key\n",                                // no database
        "[Demo]\ndatabase = x.db\n",                                // no key file
        "[Demo]\ndatabase = x.db\nkeyfile = x.key\ncolour = 3\n",   // unknown setting
        "[Demo]\ndatabase = x.db\ndatabase = y.db\nkeyfile = k\n",  // twice
        "[Demo]\ndatabase = x.db\nkeyfile = k\n[demo]\ndatabase = y\nkeyfile = k\n",
        "[a;b]\ndatabase = x.db\nkeyfile = k\n",  // bad name
        "[Demo]\ndatabase =\nkeyfile = k\n",      // empty value
    };
    for (const char* text : texts) {
        write(text);
        auto sources = loadDataSources(dir.path());
        ASSERT_FALSE(sources.ok()) << text;
        EXPECT_EQ(sources.error().number, err::kStorage);
        EXPECT_NE(sources.error().description.find("line"), std::string::npos);
        EXPECT_FALSE(findDataSource(dir.path(), "Demo").ok());
    }
}

TEST_F(DataSourcesTest, SaveAddsAndReplacesKeepingTheRest) {
    write("# keep me\n[Old]\ndatabase = old.db\nkeyfile = old.key\n");
    ASSERT_TRUE(saveDataSource(dir.path(), {"Demo", "sqlite", "demo.db", "demo.key"}).ok());
    ASSERT_TRUE(saveDataSource(dir.path(), {"demo", "sqlite", "other.db", "other.key"}).ok());
    auto sources = loadDataSources(dir.path());
    ASSERT_TRUE(sources.ok()) << sources.error().description;
    ASSERT_EQ(sources.value().size(), 2u);
    EXPECT_EQ(sources.value()[0].name, "Old");
    EXPECT_EQ(sources.value()[1].name, "demo");
    EXPECT_EQ(sources.value()[1].database, "other.db");
    EXPECT_NE(read().find("# keep me"), std::string::npos);
    // No temporary file is left behind.
    int files = 0;
    for ([[maybe_unused]] auto& e : std::filesystem::directory_iterator(dir.path()))
        ++files;
    EXPECT_EQ(files, 1);
}

TEST_F(DataSourcesTest, SaveCreatesTheFolderAndRefusesBadEntries) {
    auto sub = dir.path() / "a" / "b";
    ASSERT_TRUE(saveDataSource(sub, {"X", "sqlite", "x.db", "x.key"}).ok());
    EXPECT_TRUE(findDataSource(sub, "x").ok());

    EXPECT_EQ(saveDataSource(sub, {"bad/name", "sqlite", "x.db", "x.key"}).error().number,
              err::kBadArgument);
    EXPECT_FALSE(saveDataSource(sub, {"Y", "sqlite", "y.db\n[Z]", "y.key"}).ok());
    EXPECT_FALSE(saveDataSource(sub, {"Y", "sqlite", "", "y.key"}).ok());

    // A file that cannot be parsed is never rewritten: its entries would be lost.
    write("[Broken\n");
    EXPECT_FALSE(saveDataSource(dir.path(), {"Y", "sqlite", "y.db", "y.key"}).ok());
    EXPECT_EQ(read(), "[Broken\n");
}

TEST(DataSourceNames, AllowsOnlyTheDocumentedCharacters) {
    for (const char* good : {"Demo", "demo_1", "my-data.source", "Test data", "a",
                             "0123456789012345678901234567890123456789012345678901234567890123"})
        EXPECT_TRUE(validDataSourceName(good)) << good;
    for (const char* bad : {"", "a/b", "a\\b", "..", "[x]", "x=y", "tab\there", " lead", "trail ",
                            "semi;colon", "quote'",
                            "01234567890123456789012345678901234567890123"
                            "4567890123456789012345"})
        EXPECT_FALSE(validDataSourceName(bad)) << bad;
}

// Restores one environment variable when the test ends.
class EnvGuard {
public:
    explicit EnvGuard(const char* name) : name_(name) {
        if (const char* v = std::getenv(name))
            old_ = v;
    }
    ~EnvGuard() {
        if (old_)
            setenv(name_, old_->c_str(), 1);
        else
            unsetenv(name_);
    }
    EnvGuard(const EnvGuard&) = delete;
    EnvGuard& operator=(const EnvGuard&) = delete;

private:
    const char* name_;
    std::optional<std::string> old_;
};

TEST(DefaultDataDir, FollowsTheEnvironment) {
    EnvGuard a("KESTLOGON_DATA_DIR"), b("XDG_DATA_HOME"), c("HOME");
    setenv("HOME", "/home/someone", 1);
    unsetenv("KESTLOGON_DATA_DIR");
    unsetenv("XDG_DATA_HOME");
    EXPECT_EQ(defaultDataDir(), "/home/someone/.local/share/kestlogon");
    setenv("XDG_DATA_HOME", "/xdg", 1);
    EXPECT_EQ(defaultDataDir(), "/xdg/kestlogon");
    setenv("KESTLOGON_DATA_DIR", "/data/kest", 1);
    EXPECT_EQ(defaultDataDir(), "/data/kest");
}

}  // namespace
}  // namespace kest
