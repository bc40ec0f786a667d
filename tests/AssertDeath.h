#pragma once

// Death-test helper: the statement must stop the process with an assertion
// whose expression text is exactly `expr_text`.

#include <gtest/gtest.h>

#include <string>

namespace tarn::testing {

// A regular expression that matches `text` literally.
inline std::string RegexQuote(const std::string& text) {
    static const std::string special = R"(.[]{}()*+?^$|\)";
    std::string out;
    for (char c : text) {
        if (special.find(c) != std::string::npos) {
            out += '\\';
        }
        out += c;
    }
    return out;
}

inline std::string AssertionPattern(const std::string& expr_text) {
    return RegexQuote("Assertion \"" + expr_text + "\" failed.");
}

}  // namespace tarn::testing

#define EXPECT_TARN_ASSERT(statement, expr_text) \
    EXPECT_DEATH(statement, ::tarn::testing::AssertionPattern(expr_text))
