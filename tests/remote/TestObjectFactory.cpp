#include "remote/ObjectFactory.h"

#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>

#include "remote/RemoteServer.h"
#include "service/Errors.h"
#include "service/Provisioning.h"
#include "support/TempDir.h"

namespace kest {
namespace {

// A loopback port on which nothing listens: bound, then released.
int freePort() {
    const int fd = socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in addr{};
    addr.sin_family = AF_INET;
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    addr.sin_port = 0;
    bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr);
    socklen_t len = sizeof addr;
    getsockname(fd, reinterpret_cast<sockaddr*>(&addr), &len);
    close(fd);
    return ntohs(addr.sin_port);
}

TEST(ObjectFactory, RefusesAnUnknownProgID) {
    for (const char* progId : {"", "Kestlogon.Other", "KestlogonDBbusiness.BusinessRulesX"}) {
        auto created = CreateObject(progId, "");
        ASSERT_FALSE(created.ok()) << progId;
        EXPECT_EQ(created.error().number, err::kUnknownProgID);
    }
}

TEST(ObjectFactory, EmptyServerGivesTheServiceInProcessIgnoringCase) {
    test::TempDir dir;
    setenv("KESTLOGON_DATA_DIR", dir.path().c_str(), 1);
    ASSERT_TRUE(initDataSource({dir.path(), "Local", "admin", "secret", false}).ok());
    auto created = CreateObject("kestlogondbbusiness.businessrules", "");
    unsetenv("KESTLOGON_DATA_DIR");
    ASSERT_TRUE(created.ok()) << created.error().description;
    std::string dsn = "Local", user = "admin", password = "secret";
    RecordsetPtr record;
    auto logon = created.value()->ValidLogon(dsn, user, password, record);
    ASSERT_TRUE(logon.ok()) << logon.error().description;
    EXPECT_EQ(logon.value(), -1);
}

TEST(ObjectFactory, RefusesMalformedServerNames) {
    for (const char* server : {":50551", "host:", "host:abc", "host:0", "host:65536", "host:1:2",
                               "ho st", "[::1", "[nonsense]:1", "host;rm -rf /", "::1"}) {
        auto created = CreateObject(kBusinessRulesProgID, server);
        ASSERT_FALSE(created.ok()) << server;
        EXPECT_EQ(created.error().number, err::kBadArgument) << server;
    }
}

TEST(ObjectFactory, AnUnreachableServerIsAnErrorWithinSeconds) {
    const std::string server = "127.0.0.1:" + std::to_string(freePort());
    const auto start = std::chrono::steady_clock::now();
    auto created = CreateObject(kBusinessRulesProgID, server);
    const auto elapsed = std::chrono::steady_clock::now() - start;
    ASSERT_FALSE(created.ok());
    EXPECT_EQ(created.error().number, err::kUnreachable);
    EXPECT_NE(created.error().description.find(server), std::string::npos);
    EXPECT_LT(elapsed, std::chrono::seconds(8));
}

TEST(ObjectFactory, ConnectsToARunningServer) {
    test::TempDir dir;
    ASSERT_TRUE(initDataSource({dir.path(), "Net", "admin", "secret", false}).ok());
    auto server = RemoteServer::start(std::make_shared<ServiceCore>(dir.path()), {});
    ASSERT_TRUE(server.ok());
    const std::string name = "127.0.0.1:" + std::to_string(server.value()->port());
    auto created = CreateObject(kBusinessRulesProgID, name);
    ASSERT_TRUE(created.ok()) << name << ": " << created.error().description;
    EXPECT_TRUE(created.value()->Version(false).ok());
}

}  // namespace
}  // namespace kest
