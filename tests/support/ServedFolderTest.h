#pragma once

#include <gtest/gtest.h>

#include <memory>

#include "support/NginxServer.h"
#include "support/TestSupport.h"

namespace gwtest {

// A test whose temporary folder is served over HTTP by nginx; skipped where
// nginx is not installed.
class ServedFolderTest : public ::testing::Test {
protected:
    void SetUp() override {
        if (!NginxServer::available()) {
            GTEST_SKIP() << "nginx is not installed";
        }
        server_ = std::make_unique<NginxServer>(directory_.path());
        ASSERT_TRUE(server_->running()) << server_->failure();
    }

    TemporaryDirectory directory_;
    std::unique_ptr<NginxServer> server_;
};

}  // namespace gwtest
