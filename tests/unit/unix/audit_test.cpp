#include "unix/audit.h"

#include <gtest/gtest.h>

TEST(TheAudit, IsOneObjectAndTheDefault) {
    EXPECT_EQ(&theAudit(), &theAudit());
    EXPECT_EQ(oxAuditFile::GetDefaultAudit(), &theAudit());
}
