#include "python/PythonFunctions.h"

void BindPythonFunctions(PythonFunctions& python, HMODULE hPythonDLL, HMODULE hPythonComDLL) noexcept
{
    if (hPythonComDLL == nullptr || hPythonDLL == nullptr) {
        return;
    }
    PythonFunctions bound;
    bound.Py_DecRef = GetPythonProc<PFN_Py_DecRef>(hPythonDLL, "Py_DecRef");
    bound.PyGILState_Ensure = GetPythonProc<PFN_PyGILState_Ensure>(hPythonDLL, "PyGILState_Ensure");
    bound.PyGILState_Release = GetPythonProc<PFN_PyGILState_Release>(hPythonDLL, "PyGILState_Release");
    bound.PyErr_SetInterrupt = GetPythonProc<PFN_PyErr_SetInterrupt>(hPythonDLL, "PyErr_SetInterrupt");
    bound.PyCom_PyObjectFromVariant =
        GetPythonProc<PFN_PyCom_PyObjectFromVariant>(hPythonComDLL, "PyCom_PyObjectFromVariant");
    bound.PyCom_VariantFromPyObject =
        GetPythonProc<PFN_PyCom_VariantFromPyObject>(hPythonComDLL, "PyCom_VariantFromPyObject");

    // A partial table never stays: any missing name leaves all six null.
    bool bComplete = bound.Py_DecRef && bound.PyGILState_Ensure && bound.PyGILState_Release &&
                     bound.PyErr_SetInterrupt && bound.PyCom_PyObjectFromVariant &&
                     bound.PyCom_VariantFromPyObject;
    python = bComplete ? bound : PythonFunctions();
}
