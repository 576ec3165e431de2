#include "Transaction.h"

#include "OPCGroup.h"

CTransaction::CTransaction(DWORD id, COPCGroup *group, DWORD request) : m_id(id), m_group(group), m_request(request)
{
    m_group->AddWork();
}

CTransaction::~CTransaction()
{
    m_group->ReleaseWork();
}

HRESULT CRead2Transaction::Execute()
{
    return m_group->ExecuteRead2(m_request, m_handles);
}

CWriteValues::~CWriteValues()
{
    for (VARIANT &v : m_values)
        VariantClear(&v);
}

HRESULT CWriteValues::Add(const OPCHANDLE *handles, const VARIANT *values, const std::vector<DWORD> &which)
{
    m_handles.reserve(which.size());
    m_values.reserve(which.size());
    for (DWORD i : which) {
        m_values.emplace_back();
        VariantInit(&m_values.back());
        HRESULT hr = VariantCopy(&m_values.back(), const_cast<VARIANT *>(&values[i]));
        if (FAILED(hr)) {
            m_values.pop_back();
            return hr;
        }
        m_handles.push_back(handles[i]);
    }
    return S_OK;
}

HRESULT CWrite2Transaction::Execute()
{
    return m_group->ExecuteWrite2(m_request, m_handles, m_values);
}

HRESULT CRefresh2Transaction::Execute()
{
    return m_group->ExecuteRefresh2(m_request, m_source);
}

HRESULT CReadTransaction::Execute()
{
    return m_group->ExecuteRead(m_request, m_id, m_source, m_handles);
}

HRESULT CWriteTransaction::Execute()
{
    return m_group->ExecuteWrite(m_request, m_id, m_handles, m_values);
}

HRESULT CRefreshTransaction::Execute()
{
    return m_group->ExecuteRefresh(m_request, m_id, m_source);
}
