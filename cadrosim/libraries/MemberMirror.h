#pragma once
// A member's value, quality, time and connection as the node last sent
// them. The node sends every change to every subscription, so a library
// answers reads from it without asking the node.
#include "CadroNetwork.h"

#include <windows.h>

namespace cadrosim {

class MemberMirror {
public:
    MemberMirror() = default;
    ~MemberMirror();
    MemberMirror(const MemberMirror &) = delete;
    MemberMirror &operator=(const MemberMirror &) = delete;
    void CopyFrom(const MemberMirror &other);

    void Remember(uint32_t flags, const CadroValue &value, int32_t error, uint32_t low, uint32_t high);
    void RememberStatus(uint32_t status);
    HRESULT Recall(uint32_t *flags, CadroValue *value, int32_t *errorFlag, FILETIME *time) const;
    bool Connected() const { return m_connected; }

private:
    CadroValue m_value = {}; // kCadroNoValue until the first value
    FILETIME m_time = {};
    bool m_bad = false;
    bool m_connected = true;
};

} // namespace cadrosim
