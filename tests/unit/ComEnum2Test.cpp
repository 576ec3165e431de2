#include "ComEnum2.h"
#include "ComModule.h"

#include <gtest/gtest.h>

#include <string>

namespace {
ComPtr<IEnumString> MakeStrings(std::vector<std::wstring> values)
{
    std::vector<LPOLESTR> items;
    for (const auto &v : values)
        items.push_back(TaskStrDup(v.c_str()));
    ComPtr<IEnumString> e;
    EXPECT_EQ(CEnumString::Create(std::move(items), true, IID_IEnumString, reinterpret_cast<void **>(e.Out())), S_OK);
    return e;
}

std::vector<std::wstring> Drain(IEnumString *e)
{
    std::vector<std::wstring> out;
    LPOLESTR s = nullptr;
    while (e->Next(1, &s, nullptr) == S_OK) {
        out.emplace_back(s);
        CoTaskMemFree(s);
    }
    return out;
}
} // namespace

TEST(ComEnum2, NextSkipResetFollowTheEnumeratorRules)
{
    LONG locksBefore = ComModule::LockCount();
    {
        auto e = MakeStrings({L"a", L"b", L"c"});
        EXPECT_EQ(ComModule::LockCount(), locksBefore + 1);
        LPOLESTR got[4] = {};
        ULONG fetched = 99;
        EXPECT_EQ(e->Next(2, got, nullptr), E_POINTER) << "celt > 1 needs pceltFetched";
        EXPECT_EQ(e->Next(1, nullptr, &fetched), E_POINTER);
        EXPECT_EQ(fetched, 0u);
        EXPECT_EQ(e->Next(2, got, &fetched), S_OK);
        EXPECT_EQ(fetched, 2u);
        EXPECT_STREQ(got[0], L"a");
        EXPECT_STREQ(got[1], L"b");
        CoTaskMemFree(got[0]);
        CoTaskMemFree(got[1]);
        EXPECT_EQ(e->Next(4, got, &fetched), S_FALSE);
        EXPECT_EQ(fetched, 1u);
        CoTaskMemFree(got[0]);
        EXPECT_EQ(e->Next(1, got, &fetched), S_FALSE);
        EXPECT_EQ(fetched, 0u);
        EXPECT_EQ(e->Reset(), S_OK);
        EXPECT_EQ(e->Skip(2), S_OK);
        EXPECT_EQ(Drain(e.Get()), std::vector<std::wstring>{L"c"});
        EXPECT_EQ(e->Reset(), S_OK);
        EXPECT_EQ(e->Skip(5), S_FALSE);
        EXPECT_EQ(e->Next(1, got, &fetched), S_FALSE);
    }
    EXPECT_EQ(ComModule::LockCount(), locksBefore);
}

TEST(ComEnum2, EmptyEnumeratorFailsNext)
{
    ComPtr<IEnumUnknown> e;
    ASSERT_EQ(CEnumUnknown::Create({}, true, IID_IEnumUnknown, reinterpret_cast<void **>(e.Out())), S_OK);
    IUnknown *got = nullptr;
    ULONG fetched = 5;
    EXPECT_EQ(e->Next(1, &got, &fetched), E_FAIL);
    EXPECT_EQ(fetched, 0u);
    EXPECT_EQ(e->Skip(1), S_FALSE);
    ComPtr<IEnumString> wrong;
    EXPECT_EQ(e->QueryInterface(IID_IEnumString, reinterpret_cast<void **>(wrong.Out())), E_NOINTERFACE);
}

TEST(ComEnum2, ClonesShareTheSnapshotAndOutliveTheSource)
{
    auto e = MakeStrings({L"x", L"y", L"z"});
    LPOLESTR s = nullptr;
    ASSERT_EQ(e->Next(1, &s, nullptr), S_OK);
    CoTaskMemFree(s);
    ComPtr<IEnumString> clone;
    EXPECT_EQ(e->Clone(nullptr), E_POINTER);
    ASSERT_EQ(e->Clone(clone.Out()), S_OK);
    e.Reset(); // the clone keeps the owner's array alive
    EXPECT_EQ(Drain(clone.Get()), (std::vector<std::wstring>{L"y", L"z"}));
    clone->Reset();
    EXPECT_EQ(Drain(clone.Get()).size(), 3u);
}

TEST(ComEnum2, UnknownElementsAreReferencedAndReleased)
{
    ComPtr<IEnumString> inner = MakeStrings({L"held"});
    IUnknown *element = inner.Get();
    element->AddRef();
    ULONG before = element->AddRef() - 1;
    element->Release();
    {
        ComPtr<IEnumUnknown> e;
        ASSERT_EQ(CEnumUnknown::Create({element}, true, IID_IEnumUnknown, reinterpret_cast<void **>(e.Out())), S_OK);
        IUnknown *got = nullptr;
        ASSERT_EQ(e->Next(1, &got, nullptr), S_OK);
        EXPECT_EQ(got, element);
        EXPECT_EQ(got->AddRef(), before + 2);
        got->Release();
        got->Release();
    }
    // The enumerator released the reference it was given.
    EXPECT_EQ(element->AddRef(), before);
    element->Release();
}
