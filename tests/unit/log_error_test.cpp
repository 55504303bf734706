// The error log: exact line format, edge cases, whole lines from many threads.
#include <gtest/gtest.h>

#include <string>
#include <thread>
#include <vector>

#include "diag/LogError.h"
#include "support/DebugCapture.h"

TEST(LogError, WritesOneLineWithPrefixAndLineFeed)
{
    CDebugCapture capture;
    LogError("Cannot start interrupt thread");
    EXPECT_EQ(capture.Lines(), std::vector<std::string>{"ERROR [DeDazaRuvida]: Cannot start interrupt thread\n"});
}

TEST(LogError, NullMessageWritesNothing)
{
    CDebugCapture capture;
    LogError(nullptr);
    EXPECT_TRUE(capture.Lines().empty());
}

TEST(LogError, EmptyMessageWritesPrefixAndLineFeed)
{
    CDebugCapture capture;
    LogError("");
    EXPECT_EQ(capture.Lines(), std::vector<std::string>{"ERROR [DeDazaRuvida]: \n"});
}

TEST(LogError, PercentSignsAndConversionsComeOutUnchanged)
{
    CDebugCapture capture;
    LogError("100% %s %d %n %%");
    EXPECT_EQ(capture.Lines(), std::vector<std::string>{"ERROR [DeDazaRuvida]: 100% %s %d %n %%\n"});
}

TEST(LogError, LongMessageIsWrittenWholeInOneLine)
{
    std::string strMessage;
    for (int i = 0; i < 8000; ++i) {
        strMessage += static_cast<char>('a' + i % 26);
    }
    CDebugCapture capture;
    LogError(strMessage.c_str());
    auto vecLines = capture.Lines();
    ASSERT_EQ(vecLines.size(), 1u);
    EXPECT_EQ(vecLines[0], LogLine(strMessage));
}

TEST(LogError, LinesOfManyThreadsArriveWholeAndNeverMix)
{
    constexpr int kThreads = 8;
    constexpr int kLinesPerThread = 200;
    CDebugCapture capture;
    std::vector<std::thread> vecThreads;
    for (int t = 0; t < kThreads; ++t) {
        vecThreads.emplace_back([t] {
            std::string strMessage = "thread " + std::to_string(t) + " " + std::string(100 + t, 'x');
            for (int i = 0; i < kLinesPerThread; ++i) {
                LogError(strMessage.c_str());
            }
        });
    }
    for (auto& thread : vecThreads) {
        thread.join();
    }
    auto vecLines = capture.Lines();
    ASSERT_EQ(vecLines.size(), static_cast<size_t>(kThreads * kLinesPerThread));
    std::vector<int> vecCounts(kThreads, 0);
    for (const auto& strLine : vecLines) {
        bool bMatched = false;
        for (int t = 0; t < kThreads; ++t) {
            if (strLine == LogLine("thread " + std::to_string(t) + " " + std::string(100 + t, 'x'))) {
                ++vecCounts[t];
                bMatched = true;
            }
        }
        EXPECT_TRUE(bMatched) << "mixed or cut line: " << strLine;
    }
    for (int t = 0; t < kThreads; ++t) {
        EXPECT_EQ(vecCounts[t], kLinesPerThread);
    }
}
