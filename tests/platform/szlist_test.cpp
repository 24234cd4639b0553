// String lists: splitting, growing, joining.
#include <stdlib.h>
#include <string.h>

#include <string>
#include <vector>

#include <gtest/gtest.h>
#include <kytoplatform/kytoplatform.h>

#include "sandbox.h"

namespace {

class SzListTest : public kytotest::SandboxTest {
  protected:
    void TearDown() override {
        KLIBCSzListFree(list_);
        free(buf_);
        kytotest::SandboxTest::TearDown();
    }
    std::vector<std::string> Items() const {
        std::vector<std::string> out;
        for (int i = 0; i < list_->nItem; ++i)
            out.emplace_back(list_->pszItem[i]);
        return out;
    }
    PKLIBC_SZLIST list_ = nullptr;
    char* buf_ = nullptr;
    int bufSize_ = 0;
};

TEST_F(SzListTest, AllocRejectsBadCapacity) {
    for (int capacity : {0, -1, -1000}) {
        KLIBCErrSetEx(0, "", 0);
        EXPECT_EQ(KLIBCSzListAlloc(capacity), nullptr) << capacity;
        EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_BAD_PARAMETER);
    }
    list_ = KLIBCSzListAlloc(3);
    ASSERT_NE(list_, nullptr);
    EXPECT_EQ(list_->nItem, 0);
    EXPECT_EQ(list_->nAlloc, 3);
    KLIBCSzListFree(nullptr);
}

TEST_F(SzListTest, SplitsAtEveryDelimiterKeepingEmptyPieces) {
    struct Case {
        const char* text;
        const char* delims;
        std::vector<std::string> items;
    } cases[] = {
        {"a,b,,c", ",", {"a", "b", "", "c"}},
        {"", ",", {""}},
        {",", ",", {"", ""}},
        {"a b\tc", " \t", {"a", "b", "c"}},
        {"abc", "", {"abc"}},
        {"x;y,z", ",;", {"x", "y", "z"}},
    };
    for (const Case& c : cases) {
        list_ = KLIBCSzListAlloc(1);
        ASSERT_NE(list_, nullptr);
        EXPECT_EQ(KLIBCStrSep(c.text, c.delims, &list_), static_cast<int>(c.items.size()))
            << c.text;
        EXPECT_EQ(Items(), c.items) << c.text;
        EXPECT_GE(list_->nAlloc, list_->nItem);
        KLIBCSzListFree(list_);
        list_ = nullptr;
    }
}

TEST_F(SzListTest, GrowsAndAppendsCopies) {
    list_ = KLIBCSzListAlloc(1);
    ASSERT_NE(list_, nullptr);
    char text[] = "first,second";
    EXPECT_EQ(KLIBCStrSep(text, ",", &list_), 2);
    text[0] = 'X';  // the list holds its own copies
    std::string many;
    std::vector<std::string> expected = {"first", "second"};
    for (int i = 0; i < 200; ++i) {
        many += (i ? ":" : "") + std::to_string(i);
        expected.push_back(std::to_string(i));
    }
    EXPECT_EQ(KLIBCStrSep(many.c_str(), ":", &list_), 200);
    EXPECT_EQ(Items(), expected);
    EXPECT_GE(list_->nAlloc, 202);
}

TEST_F(SzListTest, SplitRejectsBadArguments) {
    list_ = KLIBCSzListAlloc(2);
    ASSERT_NE(list_, nullptr);
    PKLIBC_SZLIST none = nullptr;
    EXPECT_EQ(KLIBCStrSep(nullptr, ",", &list_), -1);
    EXPECT_EQ(KLIBCStrSep("a", nullptr, &list_), -1);
    EXPECT_EQ(KLIBCStrSep("a", ",", nullptr), -1);
    EXPECT_EQ(KLIBCStrSep("a", ",", &none), -1);
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_BAD_PARAMETER);
    EXPECT_EQ(list_->nItem, 0);
}

TEST_F(SzListTest, JoinAllocatesGrowsOrReusesTheBuffer) {
    list_ = KLIBCSzListAlloc(4);
    ASSERT_NE(list_, nullptr);
    // Empty list: an empty string.
    EXPECT_EQ(KLIBCSzListJoin(list_, ", ", &buf_, &bufSize_), 0);
    ASSERT_NE(buf_, nullptr);
    EXPECT_STREQ(buf_, "");
    EXPECT_GE(bufSize_, 1);

    ASSERT_EQ(KLIBCStrSep("a,,bc", ",", &list_), 3);
    EXPECT_EQ(KLIBCSzListJoin(list_, " / ", &buf_, &bufSize_), 9);
    EXPECT_STREQ(buf_, "a /  / bc");
    EXPECT_GE(bufSize_, 10);
    EXPECT_EQ(KLIBCSzListJoin(list_, "", &buf_, &bufSize_), 3);
    EXPECT_STREQ(buf_, "abc");

    // A large caller buffer is used as it is.
    free(buf_);
    bufSize_ = 64;
    buf_ = static_cast<char*>(malloc(bufSize_));
    char* before = buf_;
    EXPECT_EQ(KLIBCSzListJoin(list_, "-", &buf_, &bufSize_), 5);
    EXPECT_EQ(buf_, before);
    EXPECT_EQ(bufSize_, 64);
    EXPECT_STREQ(buf_, "a--bc");

    // A buffer exactly one byte short is grown.
    free(buf_);
    bufSize_ = 5;
    buf_ = static_cast<char*>(malloc(bufSize_));
    EXPECT_EQ(KLIBCSzListJoin(list_, "-", &buf_, &bufSize_), 5);
    EXPECT_STREQ(buf_, "a--bc");
    EXPECT_GE(bufSize_, 6);
}

TEST_F(SzListTest, JoinRejectsBadArguments) {
    list_ = KLIBCSzListAlloc(1);
    ASSERT_NE(list_, nullptr);
    int negative = -1;
    int five = 5;
    EXPECT_EQ(KLIBCSzListJoin(nullptr, ",", &buf_, &bufSize_), -1);
    EXPECT_EQ(KLIBCSzListJoin(list_, nullptr, &buf_, &bufSize_), -1);
    EXPECT_EQ(KLIBCSzListJoin(list_, ",", nullptr, &bufSize_), -1);
    EXPECT_EQ(KLIBCSzListJoin(list_, ",", &buf_, nullptr), -1);
    EXPECT_EQ(KLIBCSzListJoin(list_, ",", &buf_, &negative), -1);
    EXPECT_EQ(KLIBCSzListJoin(list_, ",", &buf_, &five), -1);  // NULL buffer claiming 5
    EXPECT_EQ(KLIBCErrGet(), KYTO_ERR_BAD_PARAMETER);
    EXPECT_EQ(buf_, nullptr);
}

}  // namespace
