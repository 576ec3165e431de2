#include "TextObject.h"

#include "Unknown.h"

namespace cadrosim {
namespace {
class CWideText : public CSimUnknown<ICadroWideText> {
public:
    explicit CWideText(std::wstring text) : m_text(std::move(text)) {}
    const wchar_t *STDMETHODCALLTYPE Chars() override { return m_text.c_str(); }

private:
    std::wstring m_text;
};

class CNarrowText : public CSimUnknown<ICadroNarrowText> {
public:
    explicit CNarrowText(std::string text) : m_text(std::move(text)) {}
    const char *STDMETHODCALLTYPE Chars() override { return m_text.c_str(); }

private:
    std::string m_text;
};
} // namespace

IUnknown *NewWideText(const std::wstring &text)
{
    return new (std::nothrow) CWideText(text);
}

IUnknown *NewNarrowText(const std::string &text)
{
    return new (std::nothrow) CNarrowText(text);
}
} // namespace cadrosim
