#pragma once

// What the embedding API's tests share: a site made from a number, and a
// fresh store directory per test, removed after it.

#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <string>

#include "tnStore/OffsetOpsStore.h"

namespace tarn::storetest {

inline Guid Site(uint32 n) {
    Guid g{};
    g.Data1 = n;
    return g;
}

// m_dir: a directory under the test's temporary one, named after the test,
// that does not exist when the test starts and is gone after it.
class StoreDirTest : public ::testing::Test {
protected:
    void SetUp() override {
        const auto* test = ::testing::UnitTest::GetInstance()->current_test_info();
        m_dir = ::testing::TempDir() + "/" + test->test_suite_name() + "-" +
                std::to_string(::getpid()) + "-" + test->name();
        std::filesystem::remove_all(m_dir);
    }
    void TearDown() override { std::filesystem::remove_all(m_dir); }

    static StoreOptions Reading() {
        StoreOptions options;
        options.mode = StoreMode::Read;
        return options;
    }

    std::string m_dir;
};

}  // namespace tarn::storetest
