#include "support/ServiceFixture.h"

#include "recordset/Value.h"
#include "remote/ObjectFactory.h"
#include "service/DataSources.h"
#include "service/LocalBusinessRules.h"
#include "service/Provisioning.h"
#include "service/TicketCache.h"

namespace kest::test {

std::string modeName(const testing::TestParamInfo<Mode>& info) {
    return info.param == Mode::Local ? "Local" : "Remote";
}

void ServiceFixture::SetUp() {
    TicketCache::instance().clear();
    InitOptions init;
    init.dataDir = dir_.path();
    init.dsn = dsn_;
    init.adminName = "admin";
    init.password = "secret";
    Status made = initDataSource(init);
    ASSERT_TRUE(made.ok()) << made.error().description;
    core_ = LocalBusinessRules::coreFor(dir_.path());
    if (GetParam() == Mode::Remote) {
        ServerOptions options;
        options.listen = "127.0.0.1:0";
        auto started = RemoteServer::start(core_, options);
        ASSERT_TRUE(started.ok()) << started.error().description;
        server_ = std::move(started.value());
        serverName_ = "127.0.0.1:" + std::to_string(server_->port());
    }
}

void ServiceFixture::TearDown() {
    if (server_)
        server_->shutdown();
    server_.reset();
    core_.reset();
    TicketCache::instance().clear();
}

BusinessObjectPtr ServiceFixture::object() {
    if (GetParam() == Mode::Local)
        return std::make_shared<LocalBusinessRules>(core_);
    auto made = CreateObject(kBusinessRulesProgID, serverName_);
    if (!made.ok()) {
        ADD_FAILURE() << made.error().description;
        return nullptr;
    }
    return made.value();
}

int32_t ServiceFixture::logon(const std::string& name, const std::string& password,
                              RecordsetPtr* record) {
    auto bo = object();
    if (!bo)
        return 0;
    std::string db = dsn_, user = name, pw = password;
    RecordsetPtr rs;
    auto r = bo->ValidLogon(db, user, pw, rs);
    if (!r.ok()) {
        ADD_FAILURE() << "ValidLogon failed: " << r.error().description;
        return 0;
    }
    if (record != nullptr)
        *record = rs;
    return r.value();
}

BusinessObjectPtr ServiceFixture::admin() {
    EXPECT_EQ(logon("admin", "secret"), -1);
    return object();
}

int32_t ServiceFixture::addUser(const NewUser& u) {
    auto bo = admin();
    std::string db = dsn_;
    auto table = bo->GetTable(db, "Users");
    if (!table.ok()) {
        ADD_FAILURE() << table.error().description;
        return 0;
    }
    RecordsetPtr rs = table.value();
    double changed = u.changed != 0 ? u.changed : roundToSecond(nowDate()).days;
    double code = 0;
    if (!u.blank) {
        std::string pw = u.password;
        auto coded = bo->PasswordCode(pw, changed);
        if (!coded.ok()) {
            ADD_FAILURE() << coded.error().description;
            return 0;
        }
        code = coded.value();
    }
    rs->AddNew();
    rs->Fields("Name").SetValue(Value(u.name));
    rs->Fields("Firstname").SetValue(Value("First " + u.name));
    rs->Fields("Lastname").SetValue(Value("Last " + u.name));
    rs->Fields("Security").SetValue(Value(int32_t{u.security}));
    rs->Fields("Active").SetValue(Value(u.active));
    rs->Fields("ExpiryDate").SetValue(Value(Date{u.expiry}));
    rs->Fields("Password").SetValue(Value(code));
    rs->Fields("PasswordChangeDate").SetValue(Value(Date{changed}));
    rs->Fields("PasswordLifetime").SetValue(Value(int32_t{u.lifetime}));
    rs->Fields("PasswordMinLength").SetValue(Value(int32_t{u.minLength}));
    rs->Fields("PasswordRemember").SetValue(Value(int32_t{u.remember}));
    rs->Fields("LogonFailCount").SetValue(Value(int32_t{u.failCount}));
    rs->Update();
    std::string table_name = "Users";
    auto written = bo->UpdateRS(db, rs, table_name);
    if (!written.ok()) {
        ADD_FAILURE() << written.error().description;
        return 0;
    }
    rs->Find("Name = '" + u.name + "'");
    return rs->Fields("UserID").Value().toInt();
}

void ServiceFixture::forgetTickets() {
    TicketCache::instance().clear();
}

std::string ServiceFixture::serverKey() const {
    if (GetParam() == Mode::Local)
        return "local:" + core_->dataDir().string();
    return serverName_;
}

std::string ServiceFixture::ticket() const {
    return TicketCache::instance().get(serverKey(), dsn_).value_or(std::string());
}

void ServiceFixture::addDataSource(const std::string& dsn) {
    InitOptions init;
    init.dataDir = dir_.path();
    init.dsn = dsn;
    init.adminName = "admin";
    init.password = "secret";
    Status made = initDataSource(init);
    ASSERT_TRUE(made.ok()) << made.error().description;
}

int64_t ServiceFixture::events(const std::string& type) {
    return scalar("SELECT COUNT(*) FROM Events WHERE Type = '" + type + "'");
}

std::filesystem::path ServiceFixture::databaseFile() const {
    auto config = findDataSource(dir_.path(), dsn_);
    if (!config.ok())
        return {};
    return resolvePath(dir_.path(), config.value().database);
}

std::unique_ptr<Connection> ServiceFixture::direct() {
    auto db = openSqlite(databaseFile(), false);
    if (!db.ok()) {
        ADD_FAILURE() << db.error().description;
        return nullptr;
    }
    return std::move(db.value());
}

int64_t ServiceFixture::scalar(const std::string& sql) {
    auto db = direct();
    int64_t n = -1;
    if (!db)
        return n;
    Status s =
        db->query(sql, {}, [&](const RowView& row) { n = row.isNull(0) ? 0 : row.getInt(0); });
    EXPECT_TRUE(s.ok()) << s.error().description;
    return n;
}

}  // namespace kest::test
