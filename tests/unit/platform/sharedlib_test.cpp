#include "platform/sharedlib.h"

#include <gtest/gtest.h>

#include <cmath>

TEST(oxSharedLib, LoadsAndFindsSymbols) {
    oxSharedLib library;
    EXPECT_FALSE(library.IsOpen());
    ASSERT_TRUE(library.Open("libm.so.6")) << library.ErrorText();
    EXPECT_TRUE(library.IsOpen());
    EXPECT_EQ("", library.ErrorText());
    void* const symbol = library.Symbol("cos");
    ASSERT_NE(nullptr, symbol);
    using Function = double (*)(double);
    EXPECT_EQ(1.0, reinterpret_cast<Function>(symbol)(0.0));
    EXPECT_EQ(nullptr, library.Symbol("no_such_symbol_anywhere"));
    library.Close();
    EXPECT_FALSE(library.IsOpen());
    EXPECT_EQ(nullptr, library.Symbol("cos"));
    library.Close();
}

TEST(oxSharedLib, KeepsTheLoadersReason) {
    oxSharedLib library;
    EXPECT_FALSE(library.Open("libnosuchlibrary.so.9"));
    EXPECT_FALSE(library.IsOpen());
    EXPECT_NE(std::string::npos, library.ErrorText().find("libnosuchlibrary.so.9")) << library.ErrorText();
    ASSERT_TRUE(library.Open("libm.so.6"));
    EXPECT_EQ("", library.ErrorText());
    EXPECT_FALSE(library.Open("")) << "the program itself is no library";
    EXPECT_FALSE(library.IsOpen()) << "the earlier one is closed first";
    EXPECT_NE("", library.ErrorText());
}
