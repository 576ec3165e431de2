#include "PatternMatch.h"

#include "CodePage.h"

namespace {
enum class Step { Match, NoMatch, Malformed };

signed char S(char c)
{
    return static_cast<signed char>(c);
}

// A character list at pattern[p] == '[' against c; next is set past "]".
Step MatchList(const std::string &pattern, size_t p, char c, size_t &next)
{
    size_t i = p + 1;
    bool excluded = i < pattern.size() && pattern[i] == '!';
    if (excluded)
        ++i;
    signed char previous = 0; // a leading range starts at code 0
    bool hit = false;
    while (!hit) {
        if (i >= pattern.size())
            return Step::Malformed; // the pattern ends inside the list
        char item = pattern[i];
        if (item == ']') {
            next = i + 1;
            return excluded ? Step::Match : Step::NoMatch;
        }
        if (item == '-') {
            if (i + 1 >= pattern.size() || pattern[i + 1] == ']')
                return Step::Malformed;
            signed char high = S(pattern[i + 1]);
            hit = S(c) >= previous && S(c) <= high;
            previous = high;
            i += 2;
        } else {
            hit = S(c) == S(item);
            previous = S(item);
            ++i;
        }
    }
    if (excluded)
        return Step::NoMatch;
    size_t close = pattern.find(']', i); // the rest of the list is skipped
    if (close == std::string::npos)
        return Step::Malformed;
    next = close + 1;
    return Step::Match;
}

// One pattern element (not "*") against one name character.
Step MatchOne(const std::string &pattern, size_t p, char c, size_t &next)
{
    next = p + 1;
    switch (pattern[p]) {
    case '?':
        return Step::Match;
    case '#':
        return c >= '0' && c <= '9' ? Step::Match : Step::NoMatch;
    case '[':
        return MatchList(pattern, p, c, next);
    default:
        return S(pattern[p]) == S(c) ? Step::Match : Step::NoMatch;
    }
}
} // namespace

bool MatchPattern(const std::string &name, const std::string &pattern)
{
    // Every element but "*" takes exactly one character, so on a mismatch it
    // is enough to let the last "*" take one character more.
    size_t p = 0, n = 0;
    size_t starP = std::string::npos, starN = 0;
    while (n < name.size()) {
        if (p < pattern.size() && pattern[p] == '*') {
            while (p < pattern.size() && pattern[p] == '*')
                ++p;
            starP = p;
            starN = n;
            continue;
        }
        size_t next = p;
        Step step = p < pattern.size() ? MatchOne(pattern, p, name[n], next) : Step::NoMatch;
        if (step == Step::Malformed)
            return false;
        if (step == Step::Match) {
            p = next;
            ++n;
            continue;
        }
        if (starP == std::string::npos)
            return false;
        p = starP;
        n = ++starN;
    }
    while (p < pattern.size() && pattern[p] == '*')
        ++p;
    return p == pattern.size();
}

bool MatchPattern(const std::wstring &name, const std::wstring &pattern)
{
    return MatchPattern(ToCodePage(name), ToCodePage(pattern));
}
