// The kestlogon tool, run as a child process the way an administrator runs it.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <fstream>
#include <sstream>
#include <thread>

#include "remote/ObjectFactory.h"
#include "service/Connection.h"
#include "service/DataSources.h"
#include "service/Errors.h"
#include "service/Provisioning.h"
#include "service/TicketCache.h"
#include "support/TempDir.h"

extern char** environ;

namespace kest {
namespace {

struct ToolRun {
    int exitCode = -1;
    std::string out;
    std::string err;
};

std::string readFile(const std::filesystem::path& file) {
    std::ifstream in(file, std::ios::binary);
    std::ostringstream text;
    text << in.rdbuf();
    return text.str();
}

std::vector<char*> argvOf(std::vector<std::string>& args) {
    std::vector<char*> argv;
    for (auto& a : args)
        argv.push_back(a.data());
    argv.push_back(nullptr);
    return argv;
}

// Runs the tool to its end with `input` on standard input.
ToolRun runTool(const test::TempDir& scratch, std::vector<std::string> args,
                const std::string& input) {
    args.insert(args.begin(), KESTLOGON_BINARY);
    const auto in = scratch.path() / "stdin";
    const auto out = scratch.path() / "stdout";
    const auto err = scratch.path() / "stderr";
    std::ofstream(in, std::ios::binary | std::ios::trunc) << input;
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, 0, in.c_str(), O_RDONLY, 0);
    posix_spawn_file_actions_addopen(&actions, 1, out.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    posix_spawn_file_actions_addopen(&actions, 2, err.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    auto argv = argvOf(args);
    pid_t pid = 0;
    ToolRun run;
    if (posix_spawn(&pid, argv[0], &actions, nullptr, argv.data(), environ) == 0) {
        int status = 0;
        waitpid(pid, &status, 0);
        run.exitCode = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    }
    posix_spawn_file_actions_destroy(&actions);
    run.out = readFile(out);
    run.err = readFile(err);
    return run;
}

// `kestlogon serve` in the background; the port is read from its
// "listening on" line.
class ServeProcess {
public:
    ServeProcess(const std::filesystem::path& dataDir) {
        int fds[2];
        if (pipe(fds) != 0)
            return;
        std::vector<std::string> args = {KESTLOGON_BINARY, "serve",    "--data-dir",
                                         dataDir.string(), "--listen", "127.0.0.1:0"};
        posix_spawn_file_actions_t actions;
        posix_spawn_file_actions_init(&actions);
        posix_spawn_file_actions_adddup2(&actions, fds[1], 1);
        posix_spawn_file_actions_addclose(&actions, fds[0]);
        auto argv = argvOf(args);
        if (posix_spawn(&pid_, argv[0], &actions, nullptr, argv.data(), environ) != 0)
            pid_ = -1;
        posix_spawn_file_actions_destroy(&actions);
        close(fds[1]);
        std::string line;
        const auto until = std::chrono::steady_clock::now() + std::chrono::seconds(20);
        while (pid_ > 0 && line.find('\n') == std::string::npos &&
               std::chrono::steady_clock::now() < until) {
            pollfd p{fds[0], POLLIN, 0};
            if (poll(&p, 1, 200) <= 0)
                continue;
            char buffer[256];
            const ssize_t n = read(fds[0], buffer, sizeof buffer);
            if (n <= 0)
                break;
            line.append(buffer, static_cast<std::size_t>(n));
        }
        close(fds[0]);
        const std::string prefix = "listening on 127.0.0.1:";
        if (line.rfind(prefix, 0) == 0)
            port_ = std::atoi(line.c_str() + prefix.size());
    }
    ~ServeProcess() {
        if (pid_ > 0) {
            kill(pid_, SIGKILL);
            waitpid(pid_, nullptr, 0);
        }
    }
    int port() const { return port_; }
    pid_t pid() const { return pid_; }
    std::string server() const { return "127.0.0.1:" + std::to_string(port_); }
    // Signals the process and returns how it ended (128 + signal when killed).
    int stop(int signal) {
        kill(pid_, signal);
        int status = 0;
        waitpid(pid_, &status, 0);
        pid_ = -1;
        return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    }

private:
    pid_t pid_ = -1;
    int port_ = 0;
};

class KestlogonTool : public ::testing::Test {
protected:
    ToolRun tool(std::vector<std::string> args, const std::string& input = "") {
        return runTool(scratch_, std::move(args), input);
    }
    void init(const std::string& dsn = "Demo") {
        const ToolRun r =
            tool({"init", "--data-dir", data_.path().string(), "--dsn", dsn, "--admin", "admin"},
                 "secret\n");
        ASSERT_EQ(r.exitCode, 0) << r.err;
    }
    std::vector<std::string> call(std::vector<std::string> rest) {
        std::vector<std::string> args = {
            "call", "--data-dir", data_.path().string(), "--dsn", "Demo", "--user", "admin"};
        args.insert(args.end(), rest.begin(), rest.end());
        return args;
    }
    std::filesystem::path databaseFile() const {
        auto config = findDataSource(data_.path(), "Demo");
        EXPECT_TRUE(config.ok());
        return resolvePath(data_.path(), config.value().database);
    }

    test::TempDir scratch_;
    test::TempDir data_;
};

TEST_F(KestlogonTool, InitReadsThePasswordFromStandardInput) {
    init();
    EXPECT_TRUE(findDataSource(data_.path(), "Demo").ok());
    EXPECT_TRUE(std::filesystem::exists(databaseFile()));
    // The same name again is refused; without a password nothing is created.
    EXPECT_NE(tool({"init", "--data-dir", data_.path().string(), "--dsn", "Demo", "--admin", "a"},
                   "secret\n")
                  .exitCode,
              0);
    const ToolRun empty =
        tool({"init", "--data-dir", data_.path().string(), "--dsn", "Other", "--admin", "a"}, "");
    EXPECT_EQ(empty.exitCode, 1);
    EXPECT_FALSE(findDataSource(data_.path(), "Other").ok());
}

TEST_F(KestlogonTool, UsageErrorsExitWithTwo) {
    for (const auto& args : std::vector<std::vector<std::string>>{
             {},
             {"frobnicate"},
             {"init", "--dsn", "X"},
             {"call", "--dsn", "Demo"},
             {"call", "--dsn", "Demo", "--user", "admin", "GetTable"},
             {"call", "--dsn", "Demo", "--user", "admin", "Explode"},
             {"serve", "--tls-cert", "c.pem"},
             {"init", "--password", "secret"}}) {
        const ToolRun r = tool(args);
        EXPECT_EQ(r.exitCode, 2) << (args.empty() ? "" : args[0]);
        EXPECT_NE(r.err.find("usage"), std::string::npos);
    }
}

TEST_F(KestlogonTool, CallPrintsATableAsCsvWithAHeader) {
    init();
    const ToolRun r = tool(call({"GetTable", "Users"}), "secret\n");
    ASSERT_EQ(r.exitCode, 0) << r.err;
    std::istringstream lines(r.out);
    std::string header, first;
    std::getline(lines, header);
    std::getline(lines, first);
    EXPECT_EQ(header.rfind("UserID,Name,", 0), 0u) << header;
    EXPECT_EQ(first.rfind("1,admin,", 0), 0u) << first;

    const ToolRun version = tool(call({"Version"}), "secret\n");
    EXPECT_EQ(version.out, std::to_string(KEST_VERSION_MAJOR) + "." +
                               std::to_string(KEST_VERSION_MINOR) + "." +
                               std::to_string(KEST_VERSION_PATCH) + "\n");
    EXPECT_EQ(tool(call({"ValidLogon"}), "secret\n").out, "-1\n");
}

TEST_F(KestlogonTool, CallWithAWrongPasswordFails) {
    init();
    const ToolRun r = tool(call({"GetTable", "Users"}), "not the password\n");
    EXPECT_EQ(r.exitCode, 1);
    EXPECT_TRUE(r.out.empty());
    EXPECT_NE(r.err.find("logon refused"), std::string::npos) << r.err;

    const ToolRun unknown = tool(call({"GetTable", "Nope'; --"}), "secret\n");
    EXPECT_EQ(unknown.exitCode, 1);
    EXPECT_EQ(unknown.err.rfind("error " + std::to_string(err::kUnknownTable) + ": ", 0), 0u)
        << unknown.err;
}

TEST_F(KestlogonTool, ServesOverTheNetworkUntilTerminated) {
    init();
    ServeProcess serve(data_.path());
    ASSERT_GT(serve.port(), 0);
    const ToolRun r = tool({"call", "--server", serve.server(), "--dsn", "Demo", "--user", "admin",
                            "GetUniqueID", "UserID"},
                           "secret\n");
    ASSERT_EQ(r.exitCode, 0) << r.err;
    EXPECT_GT(std::stoi(r.out), 1);
    EXPECT_EQ(serve.stop(SIGTERM), 0);

    const ToolRun gone =
        tool({"call", "--server", serve.server(), "--dsn", "Demo", "--user", "admin", "Version"},
             "secret\n");
    EXPECT_EQ(gone.exitCode, 1);
    EXPECT_EQ(gone.err.rfind("error " + std::to_string(err::kUnreachable) + ": ", 0), 0u)
        << gone.err;
}

// The server dies in the middle of a large batch of deletions: the database
// holds the events of before the batch or of after it, never a mixture, and
// is intact.
TEST_F(KestlogonTool, KillingTheServerDuringABatchLosesNothing) {
    constexpr int kEvents = 60'000;
    constexpr int kDeleted = 50'000;
    setenv("KESTLOGON_CALL_TIMEOUT", "60", 1);
    int inFlightKills = 0;
    for (const int delayMs : {20, 80, 250, 600, 1200}) {
        test::TempDir data;
        TicketCache::instance().clear();
        ASSERT_TRUE(initDataSource({data.path(), "Demo", "admin", "secret", false}).ok());
        const auto file =
            resolvePath(data.path(), findDataSource(data.path(), "Demo").value().database);
        auto count = [&file]() {
            auto db = openSqlite(file, false);
            EXPECT_TRUE(db.ok());
            int64_t n = -1;
            EXPECT_TRUE(db.value()
                            ->query("SELECT count(*) FROM Events", {},
                                    [&n](const RowView& row) { n = row.getInt(0); })
                            .ok());
            return n;
        };
        {
            auto db = openSqlite(file, false);
            ASSERT_TRUE(db.ok());
            ASSERT_TRUE(db.value()
                            ->execute("WITH RECURSIVE n(i) AS (SELECT 1 UNION ALL SELECT i + 1 "
                                      "FROM n WHERE i < " +
                                      std::to_string(kEvents) +
                                      ") INSERT INTO Events (EventID, Type, Date, Code, Text) "
                                      "SELECT 100000 + i, 'Test', 45000.5, i, 'event ' || i FROM n")
                            .ok());
        }

        ServeProcess serve(data.path());
        ASSERT_GT(serve.port(), 0);
        auto bo = CreateObject(kBusinessRulesProgID, serve.server());
        ASSERT_TRUE(bo.ok()) << bo.error().description;
        std::string dsn = "Demo", user = "admin", password = "secret", table = "Events";
        RecordsetPtr record;
        ASSERT_EQ(bo.value()->ValidLogon(dsn, user, password, record).value(), -1);
        auto events = bo.value()->GetTable(dsn, table);
        ASSERT_TRUE(events.ok()) << events.error().description;
        RecordsetPtr rs = events.value();
        const int64_t before = count();
        rs->MoveFirst();
        for (int i = 0; i < kDeleted; ++i) {
            rs->Delete();
            rs->MoveNext();
        }

        std::thread killer([&serve, delayMs] {
            std::this_thread::sleep_for(std::chrono::milliseconds(delayMs));
            serve.stop(SIGKILL);
        });
        auto written = bo.value()->UpdateRS(dsn, rs, table);
        killer.join();
        if (!written.ok()) {
            ++inFlightKills;
            EXPECT_TRUE(written.error().number == err::kUnreachable ||
                        written.error().number == err::kTimeout)
                << written.error().description;
        }

        const int64_t after = count();
        EXPECT_TRUE(after == before || after == before - kDeleted)
            << "before " << before << ", after " << after << ", delay " << delayMs << " ms";
        auto db = openSqlite(file, false);
        ASSERT_TRUE(db.ok());
        std::string integrity;
        ASSERT_TRUE(db.value()
                        ->query("PRAGMA integrity_check", {},
                                [&integrity](const RowView& row) {
                                    integrity = std::string(row.getText(0));
                                })
                        .ok());
        EXPECT_EQ(integrity, "ok");
        if (inFlightKills >= 2)
            break;
    }
    unsetenv("KESTLOGON_CALL_TIMEOUT");
    EXPECT_GT(inFlightKills, 0) << "the server always finished before it was killed";
}

}  // namespace
}  // namespace kest
