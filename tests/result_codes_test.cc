#include "S2S/result_codes.h"

#include <gtest/gtest.h>

#include <climits>

namespace {

TEST(ResultMessage, EveryCodeHasItsTextAsWrittenAndOutsidersAreUnknown) {
  EXPECT_STREQ(S2S::ResultMessage(0), "Successful");
  EXPECT_STREQ(S2S::ResultMessage(-5), "Protocal error");
  EXPECT_STREQ(S2S::ResultMessage(-19), "no permission ");
  EXPECT_STREQ(S2S::ResultMessage(-25), "permission is read-only");
  for (int r = 0; r > -S2S::kResultCodeCount; --r) {
    EXPECT_STRNE(S2S::ResultMessage(r), "Unknown error") << r;
  }
  for (int r : {-S2S::kResultCodeCount, 1, INT_MIN, INT_MAX}) {
    EXPECT_STREQ(S2S::ResultMessage(r), "Unknown error") << r;
  }
}

}  // namespace
