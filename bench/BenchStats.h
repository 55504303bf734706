#pragma once
// Timing and reporting helpers shared by the benchmark programs: a
// high-resolution clock, order statistics of samples, and the table rows
// that put each figure next to its floor.
#include <windows.h>

#include <algorithm>
#include <cstdio>
#include <string>
#include <vector>

// Microseconds on the performance counter.
inline double NowUs() noexcept
{
    static const double s_dUsPerTick = [] {
        LARGE_INTEGER liFreq;
        ::QueryPerformanceFrequency(&liFreq);
        return 1e6 / static_cast<double>(liFreq.QuadPart);
    }();
    LARGE_INTEGER liNow;
    ::QueryPerformanceCounter(&liNow);
    return static_cast<double>(liNow.QuadPart) * s_dUsPerTick;
}

// The value below which the fraction dQuantile of the samples lies.
inline double Quantile(std::vector<double> vecSamples, double dQuantile)
{
    if (vecSamples.empty()) return 0.0;
    size_t nIndex = static_cast<size_t>(dQuantile * static_cast<double>(vecSamples.size() - 1) + 0.5);
    std::nth_element(vecSamples.begin(), vecSamples.begin() + static_cast<std::ptrdiff_t>(nIndex), vecSamples.end());
    return vecSamples[nIndex];
}

inline double Median(const std::vector<double>& vecSamples)
{
    return Quantile(vecSamples, 0.5);
}

// One row of the report: the figure, its floor measured in the same run,
// their ratio, and the target when the figure has one.
struct BenchRow
{
    std::string strName;
    double dValue;
    double dFloor;     // 0: no floor
    std::string strUnit;
    std::string strTarget;  // empty: no target
    bool bMet;
};

inline void PrintHeader()
{
    std::printf("%-44s %14s %14s %8s  %-22s %s\n", "figure", "value", "floor", "ratio", "target", "verdict");
    std::fflush(stdout);
}

inline void PrintRow(const BenchRow& row)
{
    char szFloor[32] = "-", szRatio[32] = "-";
    if (row.dFloor > 0) {
        std::snprintf(szFloor, sizeof szFloor, "%.3f", row.dFloor);
        std::snprintf(szRatio, sizeof szRatio, "%.3f", row.dValue / row.dFloor);
    }
    const char* pszVerdict = row.strTarget.empty() ? "-" : (row.bMet ? "met" : "MISSED");
    std::printf("%-44s %14.3f %14s %8s  %-22s %s   [%s]\n", row.strName.c_str(), row.dValue, szFloor, szRatio,
                row.strTarget.empty() ? "-" : row.strTarget.c_str(), pszVerdict, row.strUnit.c_str());
    std::fflush(stdout);
}

// A free-form detail line under the table.
inline void PrintNote(const std::string& strNote)
{
    std::printf("  note: %s\n", strNote.c_str());
    std::fflush(stdout);
}
