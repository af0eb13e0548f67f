#include <gtest/gtest.h>

#include "Utility/rndctl/base/rj_text.h"

TEST(Text, HoldsACopyOrNoneAndReplacesOnSet) {
  char source[] = "alpha";
  Text t(source);
  source[0] = 'X';
  EXPECT_STREQ(t.c_str(), "alpha");
  t.set(t.c_str() + 1);  // overlapping: the copy is taken before the free
  EXPECT_STREQ(t.c_str(), "lpha");
  Text copy = t;
  t.set(nullptr);
  EXPECT_TRUE(t.none());
  EXPECT_STREQ(t.or_else("noname"), "noname");
  EXPECT_TRUE(copy.is("lpha"));
  EXPECT_FALSE(t.is("lpha"));
}
