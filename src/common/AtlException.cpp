#include "common/AtlException.h"

#include <new>

void ThrowHResult(HRESULT hr)
{
    throw CAtlException(hr);
}

HRESULT HResultFromCurrentException() noexcept
{
    try {
        throw;
    } catch (const CAtlException& e) {
        return e.Result();
    } catch (const std::bad_alloc&) {
        return E_OUTOFMEMORY;
    } catch (...) {
        return E_FAIL;
    }
}
