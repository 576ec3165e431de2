#pragma once
// Asynchronous requests waiting for the worker thread. Each holds a COM
// reference on its group and one unit of the group's pending work for its
// whole life, and owned copies of the handles and values.
#include "opcda.h"

#include <vector>

class COPCGroup;

class CTransaction {
public:
    virtual ~CTransaction();
    // Performs the request and sends its completion; the worker ignores the
    // result.
    virtual HRESULT Execute() = 0;
    // A client cancelled it while it was queued: nothing is sent.
    virtual HRESULT Cancel() { return S_OK; }
    DWORD Id() const { return m_id; }
    const COPCGroup *Group() const { return m_group; }

protected:
    CTransaction(DWORD id, COPCGroup *group, DWORD request);
    CTransaction(const CTransaction &) = delete;
    CTransaction &operator=(const CTransaction &) = delete;

    DWORD m_id;
    COPCGroup *m_group;
    DWORD m_request; // 2.0: the client's transaction id; 1.0: the advise connection
};

// Owned copies of the handles and values of a write request.
class CWriteValues {
public:
    CWriteValues() = default;
    ~CWriteValues();
    CWriteValues(const CWriteValues &) = delete;
    CWriteValues &operator=(const CWriteValues &) = delete;
    // Copies the handles and values at the indices which (VariantCopy); the
    // first failure is returned.
    HRESULT Add(const OPCHANDLE *handles, const VARIANT *values, const std::vector<DWORD> &which);

protected:
    std::vector<OPCHANDLE> m_handles;
    std::vector<VARIANT> m_values;
};

// Version 2.0 requests (IOPCAsyncIO2); completions go to IOPCDataCallback.
class CAsync2Transaction : public CTransaction {
protected:
    using CTransaction::CTransaction;
};

class CRead2Transaction : public CAsync2Transaction {
public:
    CRead2Transaction(DWORD id, COPCGroup *group, DWORD clientId, std::vector<OPCHANDLE> handles)
        : CAsync2Transaction(id, group, clientId), m_handles(std::move(handles))
    {
    }
    HRESULT Execute() override;

private:
    std::vector<OPCHANDLE> m_handles;
};

class CWrite2Transaction : public CAsync2Transaction, public CWriteValues {
public:
    CWrite2Transaction(DWORD id, COPCGroup *group, DWORD clientId) : CAsync2Transaction(id, group, clientId) {}
    HRESULT Execute() override;
};

class CRefresh2Transaction : public CAsync2Transaction {
public:
    CRefresh2Transaction(DWORD id, COPCGroup *group, DWORD clientId, OPCDATASOURCE source)
        : CAsync2Transaction(id, group, clientId), m_source(source)
    {
    }
    HRESULT Execute() override;

private:
    OPCDATASOURCE m_source;
};

// Version 1.0 requests (IOPCAsyncIO); completions go as streams to the
// IDataObject advise connection named by the request.
class CAsyncTransaction : public CTransaction {
protected:
    using CTransaction::CTransaction;
};

class CReadTransaction : public CAsyncTransaction {
public:
    CReadTransaction(DWORD id, COPCGroup *group, DWORD connection, OPCDATASOURCE source, std::vector<OPCHANDLE> handles)
        : CAsyncTransaction(id, group, connection), m_source(source), m_handles(std::move(handles))
    {
    }
    HRESULT Execute() override;

private:
    OPCDATASOURCE m_source;
    std::vector<OPCHANDLE> m_handles;
};

class CWriteTransaction : public CAsyncTransaction, public CWriteValues {
public:
    CWriteTransaction(DWORD id, COPCGroup *group, DWORD connection) : CAsyncTransaction(id, group, connection) {}
    HRESULT Execute() override;
};

class CRefreshTransaction : public CAsyncTransaction {
public:
    CRefreshTransaction(DWORD id, COPCGroup *group, DWORD connection, OPCDATASOURCE source)
        : CAsyncTransaction(id, group, connection), m_source(source)
    {
    }
    HRESULT Execute() override;

private:
    OPCDATASOURCE m_source;
};
