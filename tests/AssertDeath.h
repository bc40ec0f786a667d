#pragma once

// Death-test helpers: the statement must stop the process with an assertion
// whose expression text is exactly `expr_text` (EXPECT_TARN_ASSERT), and, with
// EXPECT_TARN_ASSERT_IN, that was checked in the function `function_text`.
// The function is matched as GCC prints __PRETTY_FUNCTION__ (see
// tnUtils/Assert.h); `function_text` must be the end of that text, so that it
// may leave out a long return type but not the parameters or qualifiers.

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

inline std::string AssertionInPattern(const std::string& function_text,
                                      const std::string& expr_text) {
    return RegexQuote(function_text + ": Assertion \"" + expr_text + "\" failed.");
}

}  // namespace tarn::testing

#define EXPECT_TARN_ASSERT(statement, expr_text) \
    EXPECT_DEATH(statement, ::tarn::testing::AssertionPattern(expr_text))

#define EXPECT_TARN_ASSERT_IN(statement, function_text, expr_text) \
    EXPECT_DEATH(statement, ::tarn::testing::AssertionInPattern(function_text, expr_text))
