// Stand-in for the Python COM-support DLL: the two VARIANT conversions, for
// the few types the server's tests pass, on objects of the runtime double.

#define PYDOUBLE_BUILD_COM
#include "py_double_api.h"

#include <oleauto.h>

#include <climits>

namespace
{

LONG g_nFromVariantCalls = 0;
LONG g_nToVariantCalls = 0;
LONG g_nBstrAllocs = 0;

long ReadCounter(LONG& nCounter)
{
    return InterlockedCompareExchange(&nCounter, 0, 0);
}

PyObject* StrFromBstr(BSTR bstr)
{
    if (bstr == nullptr)
        return TestPy_NewStrN(L"", 0);
    // By length, so that embedded nulls survive.
    return TestPy_NewStrN(bstr, static_cast<int>(SysStringLen(bstr)));
}

BOOL FillI4(PyObject* pObj, VARIANT* pVar)
{
    const long long nValue = TestPy_Int(pObj);
    if (nValue < LONG_MIN || nValue > LONG_MAX)
        return FALSE;
    V_VT(pVar) = VT_I4;
    V_I4(pVar) = static_cast<LONG>(nValue);
    return TRUE;
}

BOOL FillBstr(PyObject* pObj, VARIANT* pVar)
{
    const BSTR bstr = SysAllocStringLen(TestPy_Str(pObj), static_cast<UINT>(TestPy_StrLen(pObj)));
    if (bstr == nullptr)
        return FALSE;
    InterlockedIncrement(&g_nBstrAllocs);
    V_VT(pVar) = VT_BSTR;
    V_BSTR(pVar) = bstr;
    return TRUE;
}

}  // namespace

extern "C" {

PyObject* __cdecl PyCom_PyObjectFromVariant(const VARIANT* pVar)
{
    InterlockedIncrement(&g_nFromVariantCalls);
    TestPy_RequireLock();
    if (pVar == nullptr)
        return nullptr;
    switch (V_VT(pVar))
    {
    case VT_EMPTY:
        return TestPy_NewNone();
    case VT_I2:
        return TestPy_NewInt(V_I2(pVar));
    case VT_I4:
        return TestPy_NewInt(V_I4(pVar));
    case VT_BOOL:
        // Python's bool is an int: True is 1.
        return TestPy_NewInt(V_BOOL(pVar) != VARIANT_FALSE ? 1 : 0);
    case VT_BSTR:
        return StrFromBstr(V_BSTR(pVar));
    default:
        return nullptr;
    }
}

BOOL __cdecl PyCom_VariantFromPyObject(PyObject* pObj, VARIANT* pVar)
{
    InterlockedIncrement(&g_nToVariantCalls);
    TestPy_RequireLock();
    if (pVar == nullptr)
        return FALSE;
    switch (TestPy_Kind(pObj))
    {
    case PYDOUBLE_KIND_NONE:
        V_VT(pVar) = VT_EMPTY;
        return TRUE;
    case PYDOUBLE_KIND_INT:
        return FillI4(pObj, pVar);
    case PYDOUBLE_KIND_STR:
        return FillBstr(pObj, pVar);
    default:
        return FALSE;
    }
}

void __cdecl TestPyCom_Reset(void)
{
    InterlockedExchange(&g_nFromVariantCalls, 0);
    InterlockedExchange(&g_nToVariantCalls, 0);
    InterlockedExchange(&g_nBstrAllocs, 0);
}

long __cdecl TestPyCom_FromVariantCalls(void)
{
    return ReadCounter(g_nFromVariantCalls);
}

long __cdecl TestPyCom_ToVariantCalls(void)
{
    return ReadCounter(g_nToVariantCalls);
}

long __cdecl TestPyCom_BstrAllocs(void)
{
    return ReadCounter(g_nBstrAllocs);
}

}  // extern "C"
