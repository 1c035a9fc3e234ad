#pragma once

#include <gtest/gtest.h>

#include <filesystem>
#include <memory>
#include <string>

#include "remote/RemoteServer.h"
#include "service/BusinessRules.h"
#include "service/Connection.h"
#include "service/ServiceCore.h"
#include "support/TempDir.h"

namespace kest::test {

// How a test reaches the service: in process, or over loopback gRPC.
enum class Mode { Local, Remote };

// For INSTANTIATE_TEST_SUITE_P: names the instances "Local" and "Remote".
std::string modeName(const testing::TestParamInfo<Mode>& info);

// A user to create through the service itself (UpdateRS on "Users").
struct NewUser {
    std::string name;
    std::string password;  // coded with PasswordCode at `changed`
    int security = 8;
    bool active = true;
    double expiry = 0;   // a date number; 0 never expires
    double changed = 0;  // PasswordChangeDate; 0 means now
    int lifetime = 0;
    int minLength = 0;
    int remember = 0;
    int failCount = 0;
    bool blank = false;  // store Password 0 (reset to blank) instead of a code
};

// A fresh data source "Test" in a temporary folder (user 1 "admin" with the
// password "secret", Security 8), and service objects on it for the mode of
// the test's parameter. The process's ticket cache is cleared around each test.
class ServiceFixture : public testing::TestWithParam<Mode> {
protected:
    void SetUp() override;
    void TearDown() override;

    // A new service object, as CreateObject gives one: it shares the
    // sessions of every earlier object on the same server.
    BusinessObjectPtr object();
    // A new object logged on as admin; fails the test if the logon fails.
    BusinessObjectPtr admin();
    // Logs on with a new object; the result of ValidLogon, the record in `record`.
    int32_t logon(const std::string& name, const std::string& password,
                  RecordsetPtr* record = nullptr);
    // Creates a user as admin and returns its UserID. Leaves admin logged on.
    int32_t addUser(const NewUser& user);
    // Forgets every session ticket of this process.
    void forgetTickets();
    // The key under which this mode's objects keep their tickets in the
    // TicketCache, and the ticket they currently use for the data source.
    std::string serverKey() const;
    std::string ticket() const;
    // A second data source in the same folder, with its own admin.
    void addDataSource(const std::string& dsn);

    // A connection of the test's own on the data source's database file, for
    // reading back what the service stored and for planting broken rows.
    std::unique_ptr<Connection> direct();
    // A single number read with `direct()`, for "SELECT COUNT(*) ...".
    int64_t scalar(const std::string& sql);
    // Events of that type stored so far.
    int64_t events(const std::string& type);

    const std::filesystem::path& dataDir() const { return dir_.path(); }
    std::filesystem::path databaseFile() const;

    std::string dsn_ = "Test";

private:
    TempDir dir_;
    std::shared_ptr<ServiceCore> core_;
    std::unique_ptr<RemoteServer> server_;
    std::string serverName_;
};

}  // namespace kest::test
