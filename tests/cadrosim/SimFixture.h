#pragma once
// Loads a small network into this process's engine and opens a real-time
// session on it through CDREALT, as the server does.
#include "CadroSim.h"
#include "Recorder.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <string>

inline const wchar_t *kTestNetwork = LR"NET(
machine $HOST
  process p
    object o
      member num   type=number access=rw value=1
      member ro    type=number access=r  value=5
      member wo    type=number access=w  value=0
      member fast  type=number access=r  source=counter period=5
      member never type=number access=r  stalled=true
      member flag  type=bool   access=rw value=false
      member narrow type=text  access=rw value="abc"
      member wide  type=wtext  access=rw value="wide"
      member "(implicit)" type=number access=r value=42
      member "dash-With a description" type=number access=r value=7
    object o\inner
      member deep type=number access=r value=3
machine OTHER
  process q
    object z
      member tick type=number access=r source=counter period=20
      member noisy type=number access=r source=random period=50 min=9.5 max=10.5
)NET";

inline std::wstring Host()
{
    BSTR name = nullptr;
    GetHostMachineName(&name);
    std::wstring host = name ? name : L"";
    SysFreeString(name);
    return host;
}

inline std::wstring Command(const std::wstring &command)
{
    BSTR answer = nullptr;
    CadroSim_Execute(command.c_str(), &answer);
    std::wstring text = answer ? answer : L"";
    SysFreeString(answer);
    return text;
}

class SimTest : public testing::Test {
protected:
    void SetUp() override
    {
        BSTR error = nullptr;
        ASSERT_EQ(CadroSim_Load(kTestNetwork, &error), S_OK) << (error ? error : L"");
        ASSERT_TRUE(NewCadroRealTime(0, &recorder, &realTime));
    }
    void TearDown() override
    {
        for (CadroDataItem *item : items)
            item->Release();
        if (realTime)
            realTime->Release();
        EXPECT_EQ(recorder.Refs(), 1u) << "the library released every reference to the receiver";
    }

    // Subscribes url with a fresh cookie; null item when refused.
    CadroDataItem *Subscribe(const std::wstring &url, HRESULT *result = nullptr, void *cookie = nullptr)
    {
        SubscribeOptions options = {13, 7, 0, 0, 0};
        CadroDataItem *item = nullptr;
        HRESULT hr = realTime->Subscribe(url.c_str(), cookie ? cookie : NextCookie(), &options, &item);
        if (result)
            *result = hr;
        if (item)
            items.push_back(item);
        return item;
    }
    void *NextCookie() { return reinterpret_cast<void *>(++m_cookie); }
    void *LastCookie() { return reinterpret_cast<void *>(m_cookie); }
    void Drop(CadroDataItem *item)
    {
        items.erase(std::remove(items.begin(), items.end(), item), items.end());
        item->Release();
    }

    Recorder recorder;
    CadroRealTime *realTime = nullptr;
    std::vector<CadroDataItem *> items;

private:
    uintptr_t m_cookie = 0x1000;
};

// Deliveries of one cookie, in order.
inline std::vector<Delivery> Of(const std::vector<Delivery> &all, void *cookie)
{
    std::vector<Delivery> out;
    for (const auto &d : all)
        if (d.cookie == cookie)
            out.push_back(d);
    return out;
}

inline bool HasData(const std::vector<Delivery> &all, void *cookie, double number)
{
    for (const auto &d : all)
        if (d.cookie == cookie && d.kind == Delivery::Data && d.number == number)
            return true;
    return false;
}

// The first value delivered to cookie; a Status record when none came.
inline Delivery FirstData(const std::vector<Delivery> &all, void *cookie)
{
    for (const auto &d : all)
        if (d.cookie == cookie && d.kind == Delivery::Data)
            return d;
    return {};
}

inline size_t DataCount(const std::vector<Delivery> &all, void *cookie)
{
    size_t n = 0;
    for (const auto &d : all)
        n += d.cookie == cookie && d.kind == Delivery::Data;
    return n;
}
