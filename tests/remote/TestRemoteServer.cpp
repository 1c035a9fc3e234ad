#include "remote/RemoteServer.h"

#include <grpcpp/grpcpp.h>
#include <gtest/gtest.h>

#include <string>
#include <thread>
#include <vector>

#include "kestlogon.grpc.pb.h"
#include "remote/ObjectFactory.h"
#include "service/Errors.h"
#include "service/Provisioning.h"
#include "service/ServiceCore.h"
#include "support/TempDir.h"

namespace kest {
namespace {

class RemoteServerTest : public ::testing::Test {
protected:
    void SetUp() override {
        InitOptions init;
        init.dataDir = dir_.path();
        init.dsn = "Test";
        init.adminName = "admin";
        init.password = "secret";
        ASSERT_TRUE(initDataSource(init).ok());
        core_ = std::make_shared<ServiceCore>(dir_.path());
    }

    std::unique_ptr<RemoteServer> startServer(ServerOptions options = {}) {
        auto started = RemoteServer::start(core_, options);
        EXPECT_TRUE(started.ok()) << (started.ok() ? "" : started.error().description);
        return started.ok() ? std::move(started.value()) : nullptr;
    }

    // Sends raw frames, as a client of its own would, and returns the reply.
    static rpc::Reply exchange(int port, const std::vector<rpc::Frame>& frames) {
        auto channel = grpc::CreateChannel("127.0.0.1:" + std::to_string(port),
                                           grpc::InsecureChannelCredentials());
        auto stub = rpc::Kestlogon::NewStub(channel);
        grpc::ClientContext context;
        context.set_deadline(std::chrono::system_clock::now() + std::chrono::seconds(10));
        auto stream = stub->Call(&context);
        for (const auto& frame : frames)
            stream->Write(frame);
        stream->WritesDone();
        std::string bytes;
        rpc::Frame frame;
        while (stream->Read(&frame))
            bytes += frame.data();
        EXPECT_TRUE(stream->Finish().ok());
        rpc::Reply reply;
        EXPECT_TRUE(reply.ParseFromString(bytes));
        return reply;
    }

    static rpc::Frame frameOf(std::string data, bool last) {
        rpc::Frame frame;
        frame.set_data(std::move(data));
        frame.set_last(last);
        return frame;
    }

    static rpc::Frame versionRequest() {
        rpc::Request request;
        request.mutable_version()->set_flag(false);
        return frameOf(request.SerializeAsString(), true);
    }

    test::TempDir dir_;
    std::shared_ptr<ServiceCore> core_;
};

TEST_F(RemoteServerTest, StartsOnAFreePortAndStops) {
    auto server = startServer();
    ASSERT_TRUE(server);
    EXPECT_GT(server->port(), 0);
    EXPECT_EQ(exchange(server->port(), {versionRequest()}).error_number(), 0);
    server->shutdown();
    server->wait();
    server->shutdown();  // a second stop is harmless
}

TEST_F(RemoteServerTest, RefusesNonLoopbackAddressesWithoutTls) {
    for (const char* listen : {"0.0.0.0:0", "192.0.2.7:0", "[::]:0", "example.org:0"}) {
        ServerOptions options;
        options.listen = listen;
        auto started = RemoteServer::start(core_, options);
        ASSERT_FALSE(started.ok()) << listen;
        EXPECT_EQ(started.error().number, err::kTls) << listen;
    }
}

TEST_F(RemoteServerTest, RefusesMalformedListenAddressesAndHalfTls) {
    for (const char* listen : {"", ":0", "127.0.0.1:port", "127.0.0.1:70000", "a b:1"}) {
        ServerOptions options;
        options.listen = listen;
        EXPECT_FALSE(RemoteServer::start(core_, options).ok()) << listen;
    }
    ServerOptions halfTls;
    halfTls.tlsCertFile = (dir_.path() / "cert.pem").string();
    auto started = RemoteServer::start(core_, halfTls);
    ASSERT_FALSE(started.ok());
    EXPECT_EQ(started.error().number, err::kTls);
}

TEST_F(RemoteServerTest, AcceptsLoopbackSpellings) {
    for (const char* listen : {"127.0.0.1:0", "127.1.2.3:0", "localhost:0"}) {
        ServerOptions options;
        options.listen = listen;
        auto started = RemoteServer::start(core_, options);
        EXPECT_TRUE(started.ok()) << listen << ": "
                                  << (started.ok() ? "" : started.error().description);
    }
}

TEST_F(RemoteServerTest, GarbageIsABadMessageAndTheServerKeepsServing) {
    auto server = startServer();
    ASSERT_TRUE(server);
    const int port = server->port();

    // Bytes that are no Request at all.
    EXPECT_EQ(exchange(port, {frameOf("\xff\xff\xff\xff garbage", true)}).error_number(),
              err::kBadMessage);
    // A well-formed Request naming no operation.
    EXPECT_EQ(exchange(port, {frameOf(rpc::Request().SerializeAsString(), true)}).error_number(),
              err::kBadMessage);
    // A request whose stream ends before the last frame.
    EXPECT_EQ(exchange(port, {frameOf("partial", false)}).error_number(), err::kBadMessage);
    // A recordset that does not decode, inside a valid request.
    rpc::Request update;
    update.mutable_update_rs()->set_dsn("Test");
    update.mutable_update_rs()->set_table("Events");
    update.mutable_update_rs()->set_recordset("\x0a\x7f not a recordset");
    const rpc::Reply reply = exchange(port, {frameOf(update.SerializeAsString(), true)});
    EXPECT_EQ(reply.error_number(), err::kBadMessage) << reply.error_description();

    EXPECT_EQ(exchange(port, {versionRequest()}).error_number(), 0);
}

TEST_F(RemoteServerTest, RefusesARequestAboveTheSizeCap) {
    ServerOptions options;
    options.maxRequestBytes = 64 * 1024;
    auto server = startServer(options);
    ASSERT_TRUE(server);
    std::vector<rpc::Frame> frames;
    for (int i = 0; i < 3; ++i)
        frames.push_back(frameOf(std::string(40 * 1024, 'x'), i == 2));
    const rpc::Reply reply = exchange(server->port(), frames);
    EXPECT_EQ(reply.error_number(), err::kBadMessage);
    EXPECT_NE(reply.error_description().find("larger"), std::string::npos);
    EXPECT_EQ(exchange(server->port(), {versionRequest()}).error_number(), 0);
}

TEST_F(RemoteServerTest, ShutdownIsPromptWithACallInFlight) {
    auto server = startServer();
    ASSERT_TRUE(server);
    // A client that opens a call and never finishes its request.
    auto channel = grpc::CreateChannel("127.0.0.1:" + std::to_string(server->port()),
                                       grpc::InsecureChannelCredentials());
    auto stub = rpc::Kestlogon::NewStub(channel);
    grpc::ClientContext context;
    context.set_deadline(std::chrono::system_clock::now() + std::chrono::seconds(30));
    auto stream = stub->Call(&context);
    ASSERT_TRUE(stream->Write(frameOf("half", false)));
    std::this_thread::sleep_for(std::chrono::milliseconds(100));

    const auto start = std::chrono::steady_clock::now();
    server->shutdown();
    server->wait();
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(5));
    context.TryCancel();
    (void)stream->Finish();
}

}  // namespace
}  // namespace kest
