// Figures of the foundation, each a ratio against a baseline measured in the
// same process with the same data, so that the machine's drift cancels out.
// Subject and baseline run in turns and the median of each is compared.

#include <benchmark/benchmark.h>
#include <sqlite3.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <string>
#include <vector>

#include <unistd.h>

#include "remote/ObjectFactory.h"
#include "remote/RemoteServer.h"
#include "service/BusinessRules.h"
#include "service/Connection.h"
#include "service/LocalBusinessRules.h"
#include "service/Provisioning.h"
#include "service/Schema.h"

namespace {

using Clock = std::chrono::steady_clock;

double seconds(const std::function<void()>& work) {
    auto start = Clock::now();
    work();
    return std::chrono::duration<double>(Clock::now() - start).count();
}

double median(std::vector<double> v) {
    std::sort(v.begin(), v.end());
    return v[v.size() / 2];
}

[[noreturn]] void fail(const std::string& what) {
    std::fprintf(stderr, "bench: %s\n", what.c_str());
    std::exit(1);
}

template <class T>
T check(kest::Result<T> r, const char* step) {
    if (!r.ok())
        fail(std::string(step) + ": error " + std::to_string(r.error().number) + " " +
             r.error().description);
    return std::move(r).value();
}

void report(const char* name, double subject, double baseline, double goal) {
    double ratio = subject / baseline;
    std::printf("%s: ratio %.2f (goal %.2f)  [%.3f s vs %.3f s]\n", name, ratio, goal, subject,
                baseline);
    std::fflush(stdout);
}

// Reads every event with the SQLite C API into plain structs: what any program
// that loads the table has to do at the least.
struct EventRow {
    int id;
    std::string type;
    double date;
    int code;
    std::string text;
};

void readEventsWithSqlite(const std::filesystem::path& db) {
    sqlite3* h = nullptr;
    if (sqlite3_open_v2(db.c_str(), &h, SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK)
        fail("sqlite3_open");
    sqlite3_stmt* st = nullptr;
    sqlite3_prepare_v2(h, "SELECT EventID, Type, Date, Code, Text FROM Events ORDER BY _rid", -1,
                       &st, nullptr);
    std::vector<EventRow> rows;
    while (sqlite3_step(st) == SQLITE_ROW) {
        rows.push_back({sqlite3_column_int(st, 0),
                        reinterpret_cast<const char*>(sqlite3_column_text(st, 1)),
                        sqlite3_column_double(st, 2), sqlite3_column_int(st, 3),
                        reinterpret_cast<const char*>(sqlite3_column_text(st, 4))});
    }
    benchmark::DoNotOptimize(rows.data());
    sqlite3_finalize(st);
    sqlite3_close(h);
}

void deleteEventsWithSqlite(const std::filesystem::path& db, int firstId, int count) {
    sqlite3* h = nullptr;
    sqlite3_open_v2(db.c_str(), &h, SQLITE_OPEN_READWRITE, nullptr);
    sqlite3_exec(h, "PRAGMA journal_mode=WAL; BEGIN IMMEDIATE", nullptr, nullptr, nullptr);
    sqlite3_stmt* st = nullptr;
    sqlite3_prepare_v2(h, "DELETE FROM Events WHERE EventID = ?", -1, &st, nullptr);
    for (int id = firstId; id < firstId + count; ++id) {
        sqlite3_bind_int(st, 1, id);
        sqlite3_step(st);
        sqlite3_reset(st);
    }
    sqlite3_finalize(st);
    sqlite3_exec(h, "COMMIT", nullptr, nullptr, nullptr);
    sqlite3_close(h);
}

void fillEvents(const std::filesystem::path& db, int count) {
    auto conn = check(kest::openSqlite(db, false), "open database");
    (void)conn->execute("DELETE FROM Events");
    (void)conn->begin();
    const char* types[] = {"Logon", "Logon failed", "Password changed", "Batch update"};
    std::string sql = "INSERT INTO Events (EventID, Type, Date, Code, Text) VALUES (?, ?, ?, ?, ?)";
    for (int i = 1; i <= count; ++i) {
        kest::Value params[] = {
            kest::Value(i), kest::Value(types[i % 4]),
            kest::Value(kest::Date{46000.0 + i / 1440.0}), kest::Value(i % 4 + 1),
            kest::Value("User admin did something worth logging, number " + std::to_string(i))};
        if (!conn->execute(sql, params).ok())
            fail("insert event");
    }
    (void)conn->commit();
    // Keep the key counter above the events written behind the service's back.
    (void)conn->execute("DELETE FROM \"_Keys\" WHERE KeyField = 'EventID'");
}

}  // namespace

int main() {
    const int kEvents =
        std::getenv("KEST_BENCH_EVENTS") ? std::atoi(std::getenv("KEST_BENCH_EVENTS")) : 1000000;
    const int kDeletes = 10000;
    const int kRounds = 5;

    auto dir = std::filesystem::temp_directory_path() / ("kest-bench-" + std::to_string(getpid()));
    std::filesystem::create_directories(dir);
    kest::InitOptions init{dir, "Bench", "admin", "secret", false};
    check(kest::initDataSource(init), "init");
    std::filesystem::path db;
    for (auto& e : std::filesystem::directory_iterator(dir))
        if (e.path().extension() == ".db")
            db = e.path();
    fillEvents(db, kEvents);

    auto core = kest::LocalBusinessRules::coreFor(dir);
    auto server = check(kest::RemoteServer::start(core, {}), "start server");
    kest::BusinessObjectPtr local = std::make_shared<kest::LocalBusinessRules>(core);
    kest::BusinessObjectPtr remote =
        check(kest::CreateObject(kest::kBusinessRulesProgID,
                                 "127.0.0.1:" + std::to_string(server->port())),
              "create remote object");
    for (auto& obj : {local, remote}) {
        std::string dsn = "Bench", user = "admin", pw = "secret";
        kest::RecordsetPtr rec;
        if (check(obj->ValidLogon(dsn, user, pw, rec), "logon") == 0)
            fail("logon refused");
    }

    std::string dsn = "Bench";
    std::vector<double> base, inproc, overNet;
    for (int round = 0; round < kRounds; ++round) {
        base.push_back(seconds([&] { readEventsWithSqlite(db); }));
        inproc.push_back(seconds([&] {
            auto rs = check(local->GetTable(dsn, "Events"), "GetTable");
            benchmark::DoNotOptimize(rs.get());
        }));
        overNet.push_back(seconds([&] {
            auto rs = check(remote->GetTable(dsn, "Events"), "GetTable remote");
            benchmark::DoNotOptimize(rs.get());
        }));
    }
    report("GetTable(Events) in process vs sqlite3 read", median(inproc), median(base), 1.5);
    report("GetTable(Events) over loopback vs sqlite3 read", median(overNet), median(base), 3.0);

    std::vector<double> upd, sql;
    std::string table = "Events";
    for (int round = 0; round < kRounds; ++round) {
        auto rs = check(local->GetTable(dsn, "Events"), "GetTable");
        rs->MoveFirst();
        for (int i = 0; i < kDeletes && !rs->Eof(); ++i) {
            rs->Delete();
            rs->MoveNext();
        }
        rs->SetFilter(1);
        upd.push_back(seconds([&] {
            if (check(local->UpdateRS(dsn, rs, table), "UpdateRS") < 0)
                fail("UpdateRS refused");
        }));
        // The baseline deletes the next block of identifiers, from the far end.
        int from = kEvents - (round + 1) * kDeletes + 1;
        sql.push_back(seconds([&] { deleteEventsWithSqlite(db, from, kDeletes); }));
    }
    report("UpdateRS of 10^4 deletions vs one SQL transaction", median(upd), median(sql), 2.0);

    server->shutdown();
    std::error_code ignored;
    std::filesystem::remove_all(dir, ignored);
    return 0;
}
