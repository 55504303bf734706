// The client-text decoder: the documented cases, then a randomized
// comparison against a plain reference decoder.
#include <gtest/gtest.h>

#include <random>
#include <string>
#include <vector>

#include "host/Base64.h"

namespace {

using Bytes = std::vector<unsigned char>;

struct DecodeResult
{
    bool bOk;
    int cbReported;
    Bytes bytes;  // the whole buffer after the call
};

DecodeResult Decode(const std::string& strIn, int cbCapacity, unsigned char bFill = 0xCC)
{
    DecodeResult result{false, cbCapacity, Bytes(static_cast<size_t>(cbCapacity), bFill)};
    result.bOk = Base64Decode(strIn.c_str(), static_cast<int>(strIn.size()),
                              cbCapacity ? result.bytes.data() : reinterpret_cast<unsigned char*>(&bFill),
                              &result.cbReported);
    return result;
}

Bytes DecodeFits(const std::string& strIn)
{
    DecodeResult result = Decode(strIn, static_cast<int>(strIn.size()) + 4);
    EXPECT_TRUE(result.bOk) << strIn;
    result.bytes.resize(static_cast<size_t>(result.cbReported));
    return result.bytes;
}

// Reference: drop everything outside the alphabet (stopping at a NUL that
// begins a group of four), then decode groups of four; a last group of n
// characters yields n*6/8 bytes.
Bytes ReferenceDecode(const std::string& strIn)
{
    static const std::string kAlphabet =
        "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
    std::vector<int> vecValues;
    bool bAtGroupStart = true;  // the next byte is the first one looked at for a group
    for (char ch : strIn) {
        if (bAtGroupStart && ch == '\0') break;
        bAtGroupStart = false;
        size_t nPos = kAlphabet.find(ch);
        if (ch != '\0' && nPos != std::string::npos) {
            vecValues.push_back(static_cast<int>(nPos));
            bAtGroupStart = vecValues.size() % 4 == 0;
        }
    }
    Bytes bytes;
    for (size_t i = 0; i < vecValues.size(); i += 4) {
        size_t n = std::min<size_t>(4, vecValues.size() - i);
        unsigned long dw = 0;
        for (size_t j = 0; j < n; ++j) dw = (dw << 6) | static_cast<unsigned long>(vecValues[i + j]);
        dw <<= 6 * (4 - n);
        for (size_t j = 0; j < n * 6 / 8; ++j) bytes.push_back(static_cast<unsigned char>(dw >> (16 - 8 * j)));
    }
    return bytes;
}

}  // namespace

TEST(Base64Decode, DecodesCompleteAndShortGroups)
{
    EXPECT_EQ(DecodeFits("QUJD"), (Bytes{0x41, 0x42, 0x43}));
    EXPECT_EQ(DecodeFits("QUI"), (Bytes{0x41, 0x42}));
    EXPECT_EQ(DecodeFits("QQ"), (Bytes{0x41}));
    EXPECT_EQ(DecodeFits("QQ=="), (Bytes{0x41}));
    EXPECT_EQ(DecodeFits("Q"), Bytes{});
    EXPECT_EQ(DecodeFits("+/+/"), (Bytes{0xFB, 0xFF, 0xBF}));
}

TEST(Base64Decode, SkipsLineBreaksSpacesPaddingAndHighBytes)
{
    EXPECT_EQ(DecodeFits("QU\r\nJD"), (Bytes{0x41, 0x42, 0x43}));
    EXPECT_EQ(DecodeFits(" Q=U J\tD= "), (Bytes{0x41, 0x42, 0x43}));
    EXPECT_EQ(DecodeFits("Q\x80U\xffJD"), (Bytes{0x41, 0x42, 0x43}));
    EXPECT_EQ(DecodeFits("===="), Bytes{});
}

TEST(Base64Decode, NulEndsTheTextOnlyAtAGroupStart)
{
    // Inside a group the NUL is skipped like any other foreign byte.
    std::string strInside("QU\0JD", 5);
    EXPECT_EQ(DecodeFits(strInside), (Bytes{0x41, 0x42, 0x43}));
    std::string strAtStart("QUJD\0QUJD", 9);
    EXPECT_EQ(DecodeFits(strAtStart), (Bytes{0x41, 0x42, 0x43}));
}

TEST(Base64Decode, EmptyInputDecodesToNothingAndFitsNoBuffer)
{
    int cb = 0;
    unsigned char b = 0;
    EXPECT_TRUE(Base64Decode("", 0, &b, &cb));
    EXPECT_EQ(cb, 0);
}

TEST(Base64Decode, NullArgumentsFailWithoutTouchingTheLength)
{
    int cb = 77;
    unsigned char b[4];
    EXPECT_FALSE(Base64Decode(nullptr, 4, b, &cb));
    EXPECT_EQ(cb, 77);
    EXPECT_FALSE(Base64Decode("QUJD", 4, b, nullptr));
}

TEST(Base64Decode, NullOutputOnlyMeasures)
{
    int cb = 100;
    EXPECT_FALSE(Base64Decode("QUJDRA", 6, nullptr, &cb));
    EXPECT_EQ(cb, 4);
}

TEST(Base64Decode, OverflowKeepsEarlierGroupsAndReportsTheFullLength)
{
    DecodeResult result = Decode("QUJDREVG", 4);  // "ABCDEF" into 4 bytes
    EXPECT_FALSE(result.bOk);
    EXPECT_EQ(result.cbReported, 6);
    // The first group fitted; the second did not, and nothing of it is stored.
    EXPECT_EQ(result.bytes, (Bytes{0x41, 0x42, 0x43, 0xCC}));
}

TEST(Base64Decode, MatchesTheReferenceOnRandomInput)
{
    std::mt19937 rng(20261206);
    const std::string kAlphabet =
        "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
    const std::string kNoise = "= \r\n\t-_.*\x80\xfe";
    for (int nIteration = 0; nIteration < 20000; ++nIteration) {
        size_t cch = static_cast<size_t>(rng() % 300);
        std::string strIn;
        int nMode = static_cast<int>(rng() % 3);
        for (size_t i = 0; i < cch; ++i) {
            if (nMode == 0) {
                strIn += static_cast<char>(rng() % 256);  // any byte at all
            } else if (nMode == 1 || rng() % 8 != 0) {
                strIn += kAlphabet[rng() % 64];
            } else {
                strIn += kNoise[rng() % kNoise.size()];
            }
        }
        Bytes expected = ReferenceDecode(strIn);
        const int cbExpected = static_cast<int>(expected.size());
        // Capacities: exactly enough, plenty, and too small by a random amount.
        for (int cbCapacity : {cbExpected, cbExpected + 5, cbExpected > 0 ? static_cast<int>(rng() % cbExpected) : 0}) {
            DecodeResult result = Decode(strIn, cbCapacity);
            ASSERT_EQ(result.cbReported, cbExpected) << "iteration " << nIteration;
            ASSERT_EQ(result.bOk, cbCapacity >= cbExpected) << "iteration " << nIteration;
            // Stored bytes: whole groups before the first one that did not fit.
            int cbStored = result.bOk ? cbExpected : 0;
            if (!result.bOk) {
                // Groups yield up to 3 bytes; find how many whole-group bytes fit.
                int cbGroups = 0;
                for (int cbNext = 0; cbNext <= cbCapacity; cbNext += 3) cbGroups = cbNext;
                cbStored = std::min(cbGroups, cbExpected);
            }
            for (int i = 0; i < cbStored && i < cbCapacity; ++i) {
                ASSERT_EQ(result.bytes[static_cast<size_t>(i)], expected[static_cast<size_t>(i)]);
            }
            for (int i = cbStored; i < cbCapacity; ++i) {
                ASSERT_EQ(result.bytes[static_cast<size_t>(i)], 0xCC) << "byte stored past an overflow";
            }
        }
    }
}
