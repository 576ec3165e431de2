#include "MemberMirror.h"

#include "SimValue.h"

namespace cadrosim {

namespace {
const HRESULT kNotConnected = HRESULT_FROM_WIN32(ERROR_NOT_CONNECTED);

void Keep(CadroValue &into, const CadroValue &value)
{
    ClearCadroValue(into);
    into = value;
    if ((into.type & kCadroTextBit) && into.text)
        into.text->AddRef();
}
} // namespace

MemberMirror::~MemberMirror()
{
    ClearCadroValue(m_value);
}

void MemberMirror::CopyFrom(const MemberMirror &other)
{
    Keep(m_value, other.m_value);
    m_time = other.m_time;
    m_bad = other.m_bad;
    m_connected = other.m_connected;
}

void MemberMirror::Remember(uint32_t flags, const CadroValue &value, int32_t error, uint32_t low, uint32_t high)
{
    m_connected = true;
    if (flags & kCadroHasValue)
        Keep(m_value, value);
    if (flags & kCadroHasQuality)
        m_bad = error != 0;
    if (flags & kCadroHasTime)
        m_time = {low, high};
    else
        GetSystemTimeAsFileTime(&m_time);
}

void MemberMirror::RememberStatus(uint32_t status)
{
    if (status == kCadroStatusDisconnected)
        m_connected = false;
    else if (status == kCadroStatusContacted)
        m_connected = true;
    else if (status == kCadroStatusSubscribeFailed)
        ClearCadroValue(m_value); // the member has gone: no value to read
}

HRESULT MemberMirror::Recall(uint32_t *flags, CadroValue *value, int32_t *errorFlag, FILETIME *time) const
{
    if (!m_connected)
        return kNotConnected;
    if (m_value.type == kCadroNoValue) {
        GetSystemTimeAsFileTime(time); // no value yet: the time of the query
        return S_OK;
    }
    *value = m_value;
    if ((value->type & kCadroTextBit) && value->text)
        value->text->AddRef();
    *flags = kCadroHasValue | kCadroHasQuality | kCadroHasTime;
    *errorFlag = m_bad ? 1 : 0;
    *time = m_time;
    return S_OK;
}

} // namespace cadrosim
