// The server list object in this process: what clients may get wrong.
#include "ServerList.h"
#include "ComPtr.h"
#include "TaskMem.h"

#include <gtest/gtest.h>

#include <vector>

namespace {
const CATID kDa20 = {0x63d5f432, 0xcfe4, 0x11d1, {0xb2, 0xc8, 0x00, 0x60, 0x08, 0x3b, 0xa1, 0xfb}};
const CLSID kUnknown = {0x5b1e7a2e, 0x4c3d, 0x11d3, {0x9a, 0x44, 0x00, 0xa0, 0xc9, 0xe2, 0xb7, 0xf1}};

ComPtr<IOPCServerList2> MakeList()
{
    ComPtr<IOPCServerList2> list;
    EXPECT_EQ(COPCServerList::Create(nullptr, IID_IOPCServerList2, reinterpret_cast<void **>(list.Out())), S_OK);
    return list;
}
} // namespace

TEST(ServerList, BadInputGetsTheDocumentedCodesAndChangesNothing)
{
    ComPtr<IUnknown> outer(MakeList().Get());
    void *aggregated = nullptr;
    EXPECT_EQ(COPCServerList::Create(outer.Get(), IID_IUnknown, &aggregated), CLASS_E_NOAGGREGATION);

    ComPtr<IOPCServerList2> list = MakeList();
    ASSERT_TRUE(list);
    CATID one = kDa20;
    ComPtr<IOPCEnumGUID> classes;
    EXPECT_EQ(list->EnumClassesOfCategories(1, &one, 0, nullptr, nullptr), E_INVALIDARG);
    EXPECT_EQ(list->EnumClassesOfCategories(1, nullptr, 0, nullptr, classes.Out()), E_INVALIDARG);
    EXPECT_EQ(list->EnumClassesOfCategories(0x7fffffff, &one, 0, nullptr, classes.Out()), E_INVALIDARG);
    EXPECT_EQ(list->EnumClassesOfCategories(1, &one, 0x10000, &one, classes.Out()), E_INVALIDARG);
    EXPECT_FALSE(classes);

    LPOLESTR progId = reinterpret_cast<LPOLESTR>(1), userType = nullptr, independent = nullptr;
    EXPECT_EQ(list->GetClassDetails(kUnknown, &progId, nullptr, &independent), E_INVALIDARG);
    EXPECT_EQ(progId, nullptr) << "out pointers are cleared first";
    EXPECT_EQ(list->GetClassDetails(kUnknown, &progId, &userType, nullptr), E_INVALIDARG);
    EXPECT_EQ(list->GetClassDetails(kUnknown, &progId, &userType, &independent), REGDB_E_CLASSNOTREG);
    ComPtr<IOPCServerList> list1;
    ASSERT_EQ(list.As(list1), S_OK);
    EXPECT_EQ(list1->GetClassDetails(kUnknown, nullptr, &userType), E_INVALIDARG);
    EXPECT_EQ(list1->GetClassDetails(kUnknown, &progId, &userType), REGDB_E_CLASSNOTREG);

    CLSID clsid = kDa20;
    EXPECT_EQ(list->CLSIDFromProgID(nullptr, &clsid), E_INVALIDARG);
    EXPECT_EQ(list->CLSIDFromProgID(L"No.Such.ProgId", nullptr), E_INVALIDARG);
    EXPECT_EQ(list->CLSIDFromProgID(L"", &clsid), REGDB_E_CLASSNOTREG);
    EXPECT_EQ(list->CLSIDFromProgID(L"No.Such.ProgId", &clsid), REGDB_E_CLASSNOTREG);
    EXPECT_TRUE(IsEqualCLSID(clsid, CLSID_NULL));
    std::vector<wchar_t> unterminated(4096, L'x');
    EXPECT_EQ(list->CLSIDFromProgID(unterminated.data(), &clsid), E_INVALIDARG);
}

TEST(ServerList, EnumeratorsRunOutInsteadOfFailing)
{
    ComPtr<IOPCServerList2> list = MakeList();
    ASSERT_TRUE(list);
    // Nothing implements a category nobody registered: an empty enumerator.
    CATID nobody = kUnknown;
    ComPtr<IOPCEnumGUID> classes;
    ASSERT_EQ(list->EnumClassesOfCategories(1, &nobody, 0, nullptr, classes.Out()), S_OK);
    GUID batch[4];
    ULONG fetched = 9;
    EXPECT_EQ(classes->Next(0, batch, &fetched), S_OK);
    EXPECT_EQ(fetched, 0u);
    EXPECT_EQ(classes->Next(0x80000000u, batch, &fetched), S_FALSE);
    EXPECT_EQ(fetched, 0u);
    EXPECT_EQ(classes->Next(2, batch, nullptr), E_POINTER);
    EXPECT_EQ(classes->Skip(0x80000000u), S_FALSE);
    ComPtr<IOPCEnumGUID> clone;
    EXPECT_EQ(classes->Clone(clone.Out()), S_OK);
    EXPECT_EQ(classes->Clone(nullptr), E_POINTER);

    ComPtr<IOPCServerList> list1;
    ASSERT_EQ(list.As(list1), S_OK);
    ComPtr<IEnumGUID> classes1;
    ASSERT_EQ(list1->EnumClassesOfCategories(1, &nobody, 0xffffffffu, nullptr, classes1.Out()), S_OK);
    EXPECT_EQ(classes1->Next(1, batch, nullptr), S_FALSE);
}
