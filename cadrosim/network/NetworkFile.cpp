#include "NetworkFile.h"

#include "SocketChannel.h"

#include <algorithm>
#include <cmath>
#include <cwchar>
#include <iterator>
#include <sstream>

namespace cadrosim {

namespace {
const wchar_t kDefault[] = LR"NET(# The built-in default Cadro network.
# $HOST is this machine; PLANT7 is a second machine of the network.
machine $HOST
  process proc1
    object Waveform
      member "sine-Sine wave"     type=number access=r source=sine   period=100 cycle=10000 amplitude=100
      member "cosine-Cosine wave" type=number access=r source=cosine period=100 cycle=10000 amplitude=100
      member ramp                 type=number access=r source=ramp   period=200 cycle=20000 min=0 max=100
      member square               type=number access=r source=square period=500 cycle=4000 min=0 max=1
      member random               type=number access=r source=random period=250 min=0 max=1000
    object Counters
      member counter  type=number access=rw source=counter period=1000 step=1
      member fast     type=number access=r  source=counter period=10 step=1
      member toggle   type=bool   access=r  source=toggle  period=2000
      member ticker   type=wtext  access=r  source=counter period=1000
    object Setpoints
      member temperature type=number access=rw value=21.5
      member enabled     type=bool   access=rw value=true
      member label       type=wtext  access=rw value="Line 1"
      member code        type=text   access=rw value="A-17"
      member command     type=number access=w  value=0
      member limit       type=number access=r  value=100
      member empty       type=none   access=r
      member never       type=number access=r  stalled=true
    object Pump
      member "(implicit)"          type=number access=rw value=1
      member "speed-Pump speed"    type=number access=rw value=1450
      member status                type=text   access=r  value="running"
    object Line\Tank
      member level type=number access=r source=sine period=500 cycle=60000 amplitude=5 offset=50
      member valve type=bool   access=rw value=false
  process proc2
    object Mixer
      member rpm   type=number access=r source=random period=1000 min=90 max=110
      member batch type=wtext  access=rw value="B-001"
machine PLANT7
  process control
    object Boiler
      member pressure                          type=number access=r  source=random period=500 min=9.5 max=10.5
      member "temperature-Boiler temperature"  type=number access=r  source=sine period=1000 cycle=30000 amplitude=3 offset=180
      member burner                            type=bool   access=rw value=false
      member mode                              type=wtext  access=rw value="auto"
      member alarm                             type=bool   access=r  source=toggle period=5000
)NET";

bool ParseDouble(const std::wstring &s, double &out)
{
    wchar_t *end = nullptr;
    out = wcstod(s.c_str(), &end);
    return !s.empty() && end && *end == L'\0' && std::isfinite(out);
}

bool ParseSource(const std::wstring &s, SourceKind &out)
{
    static const struct {
        const wchar_t *name;
        SourceKind kind;
    } kinds[] = {{L"const", SourceKind::Const},     {L"sine", SourceKind::Sine},     {L"cosine", SourceKind::Cosine},
                 {L"ramp", SourceKind::Ramp},       {L"square", SourceKind::Square}, {L"random", SourceKind::Random},
                 {L"counter", SourceKind::Counter}, {L"toggle", SourceKind::Toggle}};
    for (const auto &k : kinds) {
        if (s == k.name) {
            out = k.kind;
            return true;
        }
    }
    return false;
}

bool ParseAccess(const std::wstring &s, uint32_t &out)
{
    if (s == L"r")
        out = 1;
    else if (s == L"w")
        out = 2;
    else if (s == L"rw")
        out = 3;
    else
        return false;
    return true;
}

bool ParseBool(const std::wstring &s, bool &out)
{
    if (s == L"true" || s == L"yes")
        out = true;
    else if (s == L"false" || s == L"no")
        out = false;
    else
        return false;
    return true;
}

// Applies one key=value of a member.
bool ApplyKey(const std::wstring &key, const std::wstring &value, Member &m, std::wstring &literal, bool &hasLiteral,
              std::wstring &error)
{
    double n = 0;
    Source &s = m.source;
    if (key == L"type") {
        m.type = TypeFromName(value);
        if (!m.type)
            error = L"unknown member type '" + value + L"' (bool, number, text, wtext, none)";
        return m.type != 0;
    }
    if (key == L"access") {
        if (!ParseAccess(value, m.access))
            error = L"unknown access '" + value + L"' (r, w, rw)";
        return error.empty();
    }
    if (key == L"source") {
        if (!ParseSource(value, s.kind))
            error = L"unknown source '" + value + L"' (const, sine, cosine, ramp, square, random, counter, toggle)";
        return error.empty();
    }
    if (key == L"value") {
        literal = value;
        hasLiteral = true;
        return true;
    }
    if (key == L"stalled" || key == L"quality") {
        bool flag = false;
        if (key == L"quality" && (value == L"good" || value == L"bad")) {
            m.good = value == L"good";
            return true;
        }
        if (key == L"stalled" && ParseBool(value, flag)) {
            m.stalled = flag;
            return true;
        }
        error = L"bad value '" + value + L"' for " + key;
        return false;
    }
    static const wchar_t *const numeric[] = {L"period", L"cycle", L"amplitude", L"offset", L"min", L"max", L"step"};
    if (std::find(std::begin(numeric), std::end(numeric), key) == std::end(numeric)) {
        error = L"unknown member setting '" + key + L"'";
        return false;
    }
    if (!ParseDouble(value, n)) {
        error = L"'" + key + L"' needs a number, not '" + value + L"'";
        return false;
    }
    if (key == L"period") {
        if (n < 0 || n > 86400000) {
            error = L"period must lie between 0 and 86400000 ms";
            return false;
        }
        s.period = static_cast<unsigned>(n);
    } else if (key == L"cycle") {
        if (n <= 0) {
            error = L"cycle must be positive";
            return false;
        }
        s.cycle = n;
    } else if (key == L"amplitude") {
        s.amplitude = n;
    } else if (key == L"offset") {
        s.offset = n;
    } else if (key == L"min") {
        s.min = n;
    } else if (key == L"max") {
        s.max = n;
    } else {
        s.step = n;
    }
    return true;
}
} // namespace

const wchar_t *DefaultNetworkDescription()
{
    return kDefault;
}

bool Tokenize(const std::wstring &line, std::vector<std::wstring> &tokens)
{
    tokens.clear();
    size_t i = 0;
    while (i < line.size()) {
        while (i < line.size() && iswspace(line[i]))
            ++i;
        if (i == line.size())
            break;
        std::wstring token;
        bool quoted = false;
        while (i < line.size() && (quoted || !iswspace(line[i]))) {
            if (line[i] == L'"')
                quoted = !quoted;
            else
                token += line[i];
            ++i;
        }
        if (quoted)
            return false;
        tokens.push_back(token);
    }
    return true;
}

bool ParseMemberSpec(const std::vector<std::wstring> &tokens, size_t first, Member &m, std::wstring &error)
{
    if (first >= tokens.size() || tokens[first].empty()) {
        error = L"a member needs a name";
        return false;
    }
    m.name = tokens[first];
    if (m.name == L"(implicit)")
        m.idPart.clear();
    else
        m.idPart = m.name.substr(0, m.name.find(L'-'));
    if (m.name != L"(implicit)" && (m.idPart.empty() || m.idPart.find_first_of(L"\\.'") != std::wstring::npos)) {
        error = L"member name '" + m.name + L"' cannot be used in a URL";
        return false;
    }
    std::wstring literal;
    bool hasLiteral = false;
    for (size_t i = first + 1; i < tokens.size(); ++i) {
        size_t eq = tokens[i].find(L'=');
        if (eq == std::wstring::npos || eq == 0) {
            error = L"expected key=value, found '" + tokens[i] + L"'";
            return false;
        }
        if (!ApplyKey(tokens[i].substr(0, eq), tokens[i].substr(eq + 1), m, literal, hasLiteral, error))
            return false;
    }
    if (hasLiteral && !ParseValue(m.type, literal, m.value)) {
        error = L"value '" + literal + L"' is not a " + TypeName(m.type);
        return false;
    }
    if (!hasLiteral)
        m.value = FromNumber(m.type, m.source.kind == SourceKind::Ramp ? m.source.min : m.source.offset);
    // A changing source has no value until it produces its first: the
    // starting number is only where a counter counts from.
    m.hasValue = !m.stalled && (hasLiteral || m.source.kind == SourceKind::Const);
    GetSystemTimeAsFileTime(&m.time);
    return true;
}

bool ParseNetworkDescription(const std::wstring &text, const std::wstring &hostName, Network &out, std::wstring &error)
{
    std::wistringstream lines(text);
    std::wstring line;
    Machine *machine = nullptr;
    Process *process = nullptr;
    std::wstring objectUrl;
    int number = 0;
    auto fail = [&](const std::wstring &what) {
        error = L"line " + std::to_wstring(number) + L": " + what;
        return false;
    };
    while (std::getline(lines, line)) {
        ++number;
        size_t hash = line.find(L'#');
        if (hash != std::wstring::npos && line.find(L'"') > hash)
            line.erase(hash);
        std::vector<std::wstring> tokens;
        if (!Tokenize(line, tokens))
            return fail(L"unclosed quote");
        if (tokens.empty())
            continue;
        const std::wstring &keyword = tokens[0];
        if (keyword == L"machine") {
            std::wstring node;
            if (tokens.size() == 3 && tokens[2].compare(0, 5, L"node=") == 0)
                node = tokens[2].substr(5);
            else if (tokens.size() != 2)
                return fail(L"expected: machine <name> [node=<host>:<port>]");
            std::wstring host, port;
            if (tokens.size() == 3 && !SplitNodeAddress(node, host, port))
                return fail(L"expected: node=<host>:<port>, not '" + tokens[2] + L"'");
            if (!node.empty() && tokens[1] == L"$HOST")
                return fail(L"this machine cannot be served by another node");
            std::wstring name = tokens[1] == L"$HOST" ? hostName : tokens[1];
            if (name.empty() || name.find_first_of(L"\\/ ") != std::wstring::npos)
                return fail(L"bad machine name '" + tokens[1] + L"'");
            if (out.FindMachine(name))
                return fail(L"machine '" + name + L"' is described twice");
            out.Machines().push_back(std::make_unique<Machine>());
            machine = out.Machines().back().get();
            machine->name = name;
            machine->node = node;
            process = nullptr;
            objectUrl.clear();
        } else if (keyword == L"process") {
            if (!machine)
                return fail(L"process before any machine");
            if (!machine->node.empty())
                return fail(L"machine '" + machine->name + L"' is served by the node at " + machine->node +
                            L": its processes are described there");
            if (tokens.size() != 2 || tokens[1].empty() || !iswalpha(tokens[1][0]))
                return fail(L"expected: process <name starting with a letter>");
            machine->processes.push_back(std::make_unique<Process>());
            process = machine->processes.back().get();
            process->name = tokens[1];
            objectUrl.clear();
        } else if (keyword == L"object") {
            if (!process)
                return fail(L"object before any process");
            if (tokens.size() != 2 || tokens[1].empty() || tokens[1].find_first_of(L".'") != std::wstring::npos)
                return fail(L"expected: object <name>[\\<name>...]");
            objectUrl = L"\\\\" + machine->name + L"\\" + process->name + L"\\" + tokens[1];
            std::wstring what;
            if (!out.EnsureObject(objectUrl, what)) // empty objects exist too
                return fail(L"bad object path '" + tokens[1] + L"'");
        } else if (keyword == L"member") {
            if (objectUrl.empty())
                return fail(L"member before any object");
            auto member = MemberPtr::Make();
            std::wstring what;
            if (!ParseMemberSpec(tokens, 1, *member, what))
                return fail(what);
            if (!out.AddMember(objectUrl, member, what))
                return fail(what);
        } else {
            return fail(L"unknown keyword '" + keyword + L"' (machine, process, object, member)");
        }
    }
    return true;
}

} // namespace cadrosim
