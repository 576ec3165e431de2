#include "Wire.h"

#include "SimValue.h"
#include "TextObject.h"

#include <cstring>

namespace cadrosim::wire {

void Out::Begin(Kind kind)
{
    m_frameStart = m_bytes.size();
    U32(0);
    U8(static_cast<uint8_t>(kind));
}

void Out::End()
{
    uint32_t length = static_cast<uint32_t>(m_bytes.size() - m_frameStart - 4);
    memcpy(&m_bytes[m_frameStart], &length, 4);
}

bool Out::ExtendLast(Kind kind, std::string_view fields, uint32_t id)
{
    // The fields describe their own length (a value says its type), so a
    // frame whose first bytes equal them has exactly these fields.
    if (m_frameStart == SIZE_MAX || m_bytes.size() < m_frameStart + 5 + fields.size() ||
        static_cast<uint8_t>(m_bytes[m_frameStart + 4]) != static_cast<uint8_t>(kind))
        return false;
    // Values of different members mostly differ in their last bytes (the
    // number and the time): those first, without a call.
    const char *last = m_bytes.data() + m_frameStart + 5;
    if (fields.size() >= 8) {
        uint64_t a, b;
        memcpy(&a, last + fields.size() - 8, 8);
        memcpy(&b, fields.data() + fields.size() - 8, 8);
        if (a != b)
            return false;
    }
    if (memcmp(last, fields.data(), fields.size()) != 0)
        return false;
    U32(id);
    End();
    return true;
}

void Out::Frame(Kind kind, std::string_view fields, uint32_t id)
{
    const size_t at = m_bytes.size();
    const auto length = static_cast<uint32_t>(1 + fields.size() + 4);
    m_bytes.resize(at + 4 + length);
    char *p = m_bytes.data() + at;
    memcpy(p, &length, 4);
    p[4] = static_cast<char>(kind);
    memcpy(p + 5, fields.data(), fields.size());
    memcpy(p + 5 + fields.size(), &id, 4);
    m_frameStart = at;
}

void Out::Clear()
{
    m_bytes.clear();
    m_frameStart = SIZE_MAX;
}

void Out::Take(std::string &into)
{
    // The buffers change places: into's goes on collecting frames here.
    into.clear();
    into.swap(m_bytes);
    m_frameStart = SIZE_MAX;
}

void Out::Text(std::wstring_view text)
{
    U32(static_cast<uint32_t>(text.size()));
    Raw(text.data(), text.size() * sizeof(wchar_t));
}

void Out::Value(const CadroValue &value)
{
    U32(value.type);
    if (value.type & kCadroTextBit) {
        // Texts travel as wide characters whatever the object's width.
        std::wstring chars;
        TextOf(value, chars);
        Text(chars);
    } else if (value.type == kCadroBoolean) {
        U8(value.boolean);
    } else {
        F64(value.number);
    }
}

std::wstring In::Text()
{
    uint32_t n = U32();
    if (!m_ok || static_cast<size_t>(m_end - m_p) / sizeof(wchar_t) < n) {
        m_ok = false;
        m_p = m_end;
        return {};
    }
    std::wstring text(n, L'\0');
    memcpy(text.data(), m_p, n * sizeof(wchar_t));
    m_p += n * sizeof(wchar_t);
    return text;
}

void In::Value(CadroValue &value)
{
    value = {};
    value.type = U32();
    if (value.type & kCadroTextBit) {
        std::wstring chars = Text();
        if (value.type == kCadroNarrowText) {
            int n = WideCharToMultiByte(CP_ACP, 0, chars.c_str(), -1, nullptr, 0, nullptr, nullptr);
            std::string narrow(n > 0 ? n - 1 : 0, '\0');
            if (n > 1)
                WideCharToMultiByte(CP_ACP, 0, chars.c_str(), -1, narrow.data(), n, nullptr, nullptr);
            value.text = narrow.empty() ? nullptr : NewNarrowText(narrow);
        } else {
            value.text = chars.empty() ? nullptr : NewWideText(chars);
        }
    } else if (value.type == kCadroBoolean) {
        value.boolean = U8();
    } else {
        value.number = F64();
    }
}

} // namespace cadrosim::wire
