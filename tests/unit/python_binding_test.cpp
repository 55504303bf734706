// Binding the Python entry points by name: all or nothing, never logged;
// and the interpreter-lock bracket.
#include <gtest/gtest.h>

#include "py_double_api.h"
#include "python/PythonFunctions.h"
#include "support/DebugCapture.h"

namespace {

HMODULE Runtime() { return ::GetModuleHandleW(L"PyRuntimeDouble.dll"); }
HMODULE ComSupport() { return ::GetModuleHandleW(L"PyComDouble.dll"); }

bool AllNull(const PythonFunctions& python)
{
    return !python.Py_DecRef && !python.PyGILState_Ensure && !python.PyGILState_Release &&
           !python.PyErr_SetInterrupt && !python.PyCom_PyObjectFromVariant && !python.PyCom_VariantFromPyObject;
}

class CLibrary
{
public:
    explicit CLibrary(const wchar_t* pszName) : m_h(::LoadLibraryW(pszName)) {}
    ~CLibrary() { if (m_h) ::FreeLibrary(m_h); }
    HMODULE Get() const { return m_h; }

private:
    HMODULE m_h;
};

}  // namespace

TEST(BindPythonFunctions, BothModulesBindAllSixToTheirExports)
{
    ASSERT_NE(Runtime(), nullptr);
    ASSERT_NE(ComSupport(), nullptr);
    CDebugCapture capture;
    PythonFunctions python;
    BindPythonFunctions(python, Runtime(), ComSupport());
    EXPECT_EQ(python.Py_DecRef, &::Py_DecRef);
    EXPECT_EQ(python.PyGILState_Ensure, &::PyGILState_Ensure);
    EXPECT_EQ(python.PyGILState_Release, &::PyGILState_Release);
    EXPECT_EQ(python.PyErr_SetInterrupt, &::PyErr_SetInterrupt);
    EXPECT_EQ(python.PyCom_PyObjectFromVariant, &::PyCom_PyObjectFromVariant);
    EXPECT_EQ(python.PyCom_VariantFromPyObject, &::PyCom_VariantFromPyObject);
    EXPECT_TRUE(python.IsBound());
    EXPECT_TRUE(capture.Lines().empty());
}

TEST(BindPythonFunctions, NullComModuleLeavesTheTableEmpty)
{
    CDebugCapture capture;
    PythonFunctions python;
    BindPythonFunctions(python, Runtime(), nullptr);
    EXPECT_TRUE(AllNull(python));
    EXPECT_FALSE(python.IsBound());
    BindPythonFunctions(python, nullptr, ComSupport());
    EXPECT_TRUE(AllNull(python));
    EXPECT_TRUE(capture.Lines().empty());
}

TEST(BindPythonFunctions, OneMissingNameLeavesAllSixNull)
{
    CLibrary noInterrupt(L"PyRuntimeNoInterrupt.dll");
    ASSERT_NE(noInterrupt.Get(), nullptr);
    CDebugCapture capture;
    PythonFunctions python;
    BindPythonFunctions(python, noInterrupt.Get(), ComSupport());
    EXPECT_TRUE(AllNull(python));
    EXPECT_TRUE(capture.Lines().empty());
}

TEST(BindPythonFunctions, ModuleWithoutTheNamesLeavesAllSixNull)
{
    // kernel32 exports none of the names: the runtime lookups all fail.
    PythonFunctions python;
    BindPythonFunctions(python, ::GetModuleHandleW(L"kernel32.dll"), ComSupport());
    EXPECT_TRUE(AllNull(python));
}

TEST(GilLock, PairsEnsureAndReleaseOnTheSameThreadEvenOnEarlyReturn)
{
    PythonFunctions python;
    BindPythonFunctions(python, Runtime(), ComSupport());
    ASSERT_TRUE(python.IsBound());
    TestPy_Reset();
    auto fnWork = [&](bool bReturnEarly) -> int {
        CGilLock lock(python);
        EXPECT_EQ(TestPy_GilOwner(), ::GetCurrentThreadId());
        if (bReturnEarly) return 1;
        return 2;
    };
    EXPECT_EQ(fnWork(true), 1);
    EXPECT_EQ(fnWork(false), 2);
    EXPECT_EQ(TestPy_EnsureCalls(), 2);
    EXPECT_EQ(TestPy_ReleaseCalls(), 2);
    EXPECT_EQ(TestPy_GilOwner(), 0u);
    EXPECT_EQ(TestPy_GilErrors(), 0);
}

TEST(GilLock, NestedBracketKeepsTheLockUntilTheOuterOneEnds)
{
    PythonFunctions python;
    BindPythonFunctions(python, Runtime(), ComSupport());
    TestPy_Reset();
    {
        CGilLock outer(python);
        {
            CGilLock inner(python);
            EXPECT_EQ(TestPy_GilDepth(), 2);
        }
        EXPECT_EQ(TestPy_GilOwner(), ::GetCurrentThreadId());
    }
    EXPECT_EQ(TestPy_GilOwner(), 0u);
    EXPECT_EQ(TestPy_GilErrors(), 0);
}
