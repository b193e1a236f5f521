#include "S2S/result_codes.h"

#include <gtest/gtest.h>

#include <climits>
#include <string>

namespace {

TEST(ResultMessage, TableEndsAndOutsiders) {
  EXPECT_STREQ(S2S::ResultMessage(0), "Successful");
  EXPECT_STREQ(S2S::ResultMessage(-5), "Protocal error");
  EXPECT_STREQ(S2S::ResultMessage(-25), "permission is read-only");
  EXPECT_STREQ(S2S::ResultMessage(-26), "Unknown error");
  EXPECT_STREQ(S2S::ResultMessage(1), "Unknown error");
  EXPECT_STREQ(S2S::ResultMessage(INT_MIN), "Unknown error");
  EXPECT_STREQ(S2S::ResultMessage(INT_MAX), "Unknown error");
}

TEST(ResultMessage, VocabularyKeptAsWritten) {
  EXPECT_EQ(std::string(S2S::ResultMessage(-19)), "no permission ");
  EXPECT_STREQ(S2S::ResultMessage(S2S::kInvalidArgument), "Invalid argument");
  EXPECT_STREQ(S2S::ResultMessage(S2S::kConnectionTimeout),
               "Connection timeout");
  EXPECT_STREQ(S2S::ResultMessage(-21), "connection about by setting flag");
  EXPECT_STREQ(S2S::ResultMessage(S2S::kSSLVerifyFail),
               "ssl certificate verify fail");
  for (int r = 0; r > -S2S::kResultCodeCount; --r) {
    EXPECT_STRNE(S2S::ResultMessage(r), "Unknown error") << r;
  }
}

}  // namespace
