// The control socket's client against a service that accepts the connection and never answers:
// the request gives up after its bounded wait instead of hanging its caller.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <chrono>
#include <future>

#include "s2s_control.h"
#include "s2s_control_client.h"
#include "s2s_ipc.h"
#include "support/test_util.h"

namespace {

namespace Control = S2S::Control;

TEST(ControlClient, AServiceThatAcceptsAndStaysSilentIsGivenUpOnAfterTheTimeout) {
    s2s_test::TempDir root;
    s2s_test::ScopedEnv env("S2S_ROOT", root.path().c_str());
    ASSERT_EQ(mkdir((root / "run").c_str(), 0700), 0);
    ASSERT_EQ(mkdir((root / "run/s2s").c_str(), 0700), 0);
    S2S::IPCListener listener;
    ASSERT_EQ(listener.prepare(root.path() + Control::kSocketPath), 0);

    const auto start = std::chrono::steady_clock::now();
    std::string error;
    std::future<int> asked = std::async(std::launch::async, [&] {
        S2S::PObject request;
        request[Control::kKeyCommand] = Control::kList;
        S2S::PObject reply;
        return Control::Request(request, reply, error, 1);
    });
    ASSERT_TRUE(listener.isReady());
    S2S::IPCSender accepted;
    ASSERT_EQ(accepted.assign(listener.accept()), 0);

    ASSERT_EQ(asked.wait_for(std::chrono::seconds(20)), std::future_status::ready)
        << "the request still waits for the silent service";
    EXPECT_EQ(asked.get(), -1);
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(10));
    EXPECT_NE(error.find("did not answer"), std::string::npos) << error;
}

}  // namespace
