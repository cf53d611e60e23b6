#include "nqportmanager/com.h"

#include <nqportmanager/ComPtr.h>

#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <thread>
#include <tuple>
#include <utility>
#include <vector>

namespace {

// Results of a sequence of calls, compared in one go; braced lists evaluate left to right.
using Results = std::vector<HRESULT>;

#ifdef _WIN32
// The texts below are char16_t literals; Windows' OLECHAR is the same UTF-16 unit as wchar_t.
using ::SysAllocString;
using ::SysReAllocString;
using ::SysReAllocStringLen;
const OLECHAR* Ole(const char16_t* s) {
    return reinterpret_cast<const OLECHAR*>(s);
}
BSTR SysAllocString(const char16_t* s) {
    return ::SysAllocString(Ole(s));
}
BSTR SysAllocString(std::nullptr_t) {
    return ::SysAllocString(nullptr);
}
INT SysReAllocString(BSTR* b, const char16_t* s) {
    return ::SysReAllocString(b, Ole(s));
}
INT SysReAllocString(BSTR* b, std::nullptr_t) {
    return ::SysReAllocString(b, nullptr);
}
INT SysReAllocStringLen(BSTR* b, const char16_t* s, UINT n) {
    return ::SysReAllocStringLen(b, Ole(s), n);
}
INT SysReAllocStringLen(BSTR* b, std::nullptr_t, UINT n) {
    return ::SysReAllocStringLen(b, nullptr, n);
}
#endif

std::u16string Str(BSTR b) {
    return std::u16string(BstrView(b));
}

VARIANT Var(VARTYPE vt = VT_EMPTY) {
    VARIANT v;
    VariantInit(&v);
    EXPECT_EQ(v.vt, VT_EMPTY);
    v.vt = vt;
    return v;
}

// Serves as both IUnknown and IDispatch; counts references so leaks and over-releases show.
class Counting final : public IDispatch {
  public:
    HRESULT QueryInterface(REFIID, void** ppv) override { return *ppv = nullptr, E_NOINTERFACE; }
    ULONG AddRef() override { return ++refs; }
    ULONG Release() override { return --refs; }
    HRESULT GetTypeInfoCount(UINT*) override { return E_NOTIMPL; }
    HRESULT GetTypeInfo(UINT, LCID, ITypeInfo**) override { return E_NOTIMPL; }
    HRESULT GetIDsOfNames(REFIID, LPOLESTR*, UINT, LCID, DISPID*) override { return E_NOTIMPL; }
    HRESULT Invoke(DISPID, REFIID, LCID, WORD, DISPPARAMS*, VARIANT*, EXCEPINFO*, UINT*) override {
        return E_NOTIMPL;
    }
    ULONG After(HRESULT hr) {  // the count after a call that must succeed
        EXPECT_EQ(hr, S_OK);
        return refs;
    }
    ULONG refs = 1;
};
using Refs = std::vector<ULONG>;

TEST(ComGuid, LiteralsStringsParsingAndEquality) {
    EXPECT_EQ(GuidToString(IID_IConnectionPoint), "{B196B286-BAB4-101A-B69C-00AA00341D07}");
    for (const GUID& id : {IID_IUnknown, IID_IDispatch, IID_IConnectionPointContainer,
                           IID_ISupportErrorInfo, IID_IEnumConnections, GUID_NULL}) {
        GUID parsed{};
        ASSERT_TRUE(GuidFromString(GuidToString(id), &parsed));
        EXPECT_TRUE(IsEqualIID(parsed, id));
    }
    GUID almost = IID_IConnectionPoint;
    almost.Data4[7] ^= 1;
    EXPECT_FALSE(IsEqualGUID(almost, IID_IConnectionPoint));

    GUID out{};
    ASSERT_TRUE(GuidFromString("df0b3d60-548f-101b-8E65-08002b2bd119", &out));  // no braces
    EXPECT_EQ(out, IID_ISupportErrorInfo);
    const std::string ok = "DF0B3D60-548F-101B-8E65-08002B2BD119";
    for (const std::string& bad : {"{" + ok, ok.substr(0, 35), ok + "0",
                                   ok.substr(0, 23) + "08-002B2BD119", "DF0B3D6G" + ok.substr(8)}) {
        GUID untouched = IID_IUnknown;
        EXPECT_FALSE(GuidFromString(bad, &untouched)) << bad;
        EXPECT_EQ(untouched, IID_IUnknown) << bad;
    }
    EXPECT_FALSE(GuidFromString(ok, nullptr));
}

TEST(ComBstr, LayoutLengthsAndEmbeddedZeros) {
    BSTR b = SysAllocString(u"abc");
    ASSERT_NE(b, nullptr);
    uint32_t prefix = 0;
    std::memcpy(&prefix, reinterpret_cast<const char*>(b) - sizeof(prefix), sizeof(prefix));
    EXPECT_EQ(std::make_tuple(prefix, SysStringByteLen(b), SysStringLen(b), b[3]),
              std::make_tuple(6u, 6u, 3u, u'\0'));
    SysFreeString(b);
    BSTR empty = SysAllocString(u"");
    ASSERT_NE(empty, nullptr);  // empty is not null
    EXPECT_EQ(empty[0], u'\0');
    SysFreeString(empty);

    const OLECHAR src[] = {u'a', u'\0', u'b'};
    b = SysAllocStringLen(src, 3);
    EXPECT_EQ(Str(b), std::u16string(u"a\0b", 3));
    EXPECT_EQ(b[3], u'\0');
    SysFreeString(b);
    b = SysAllocStringLen(nullptr, 4);
    ASSERT_NE(b, nullptr);
    EXPECT_EQ(Str(b), std::u16string(4, u'\0'));
    SysFreeString(b);

    BSTR bytes = SysAllocStringByteLen("xyz", 3);
    ASSERT_NE(bytes, nullptr);
    EXPECT_EQ(std::make_pair(SysStringByteLen(bytes), SysStringLen(bytes)), std::make_pair(3u, 1u));
    EXPECT_EQ(std::string(reinterpret_cast<const char*>(bytes), 5), std::string("xyz\0\0", 5));
    SysFreeString(bytes);
    // The byte count would not fit the 4-byte prefix.
    EXPECT_EQ(SysAllocStringLen(nullptr, 0x80000000u), nullptr);
}

TEST(ComBstr, NullsAndReAlloc) {
    EXPECT_EQ(SysAllocString(nullptr), nullptr);
    EXPECT_EQ(SysStringLen(nullptr) + SysStringByteLen(nullptr), 0u);
    SysFreeString(nullptr);
    EXPECT_FALSE(SysReAllocString(nullptr, u"x"));
    EXPECT_FALSE(SysReAllocStringLen(nullptr, u"x", 1));
    EXPECT_TRUE(BstrView(nullptr).empty());
    EXPECT_EQ(Utf8FromBstr(nullptr), "");

    BSTR b = nullptr;
    ASSERT_TRUE(SysReAllocString(&b, u"from null"));
    ASSERT_TRUE(SysReAllocString(&b, u"longer string"));
    EXPECT_EQ(Str(b), u"longer string");
    ASSERT_TRUE(SysReAllocStringLen(&b, b + 1, 5));  // source inside the old string
    EXPECT_EQ(Str(b), u"onger");
    // Null source keeps what fits and zero-fills the rest.
    ASSERT_TRUE(SysReAllocStringLen(&b, nullptr, 7));
    EXPECT_EQ(Str(b), std::u16string(u"onger\0\0", 7));
    ASSERT_TRUE(SysReAllocStringLen(&b, nullptr, 2));
    EXPECT_EQ(Str(b), u"on");
    EXPECT_EQ(b[2], u'\0');
    ASSERT_TRUE(SysReAllocString(&b, nullptr));
    EXPECT_EQ(b, nullptr);
}

TEST(ComUtf8, ConversionBothWays) {
    const std::string utf8 = "a\xC3\xA9\xE2\x82\xAC\xF0\x9F\x98\x80";  // a é € U+1F600
    BStr b(utf8);
    EXPECT_EQ(Str(b.Get()), u"a\u00E9\u20AC\U0001F600");
    EXPECT_EQ(b.Utf8(), utf8);
    EXPECT_EQ(BStr(std::string_view("a\0b", 3)).Utf8(), std::string("a\0b", 3));
    EXPECT_FALSE(BStr(std::string_view{}).IsNull());

    const std::pair<std::string, std::u16string> invalid[] = {
        {"\xFF"
         "a\x80z",
         u"\uFFFDa\uFFFDz"},                                // invalid lead, stray continuation
        {"\xC0\xAF", u"\uFFFD\uFFFD"},                      // overlong '/'
        {"\xED\xA0\x80", u"\uFFFD\uFFFD\uFFFD"},            // encoded surrogate
        {"\xF4\x90\x80\x80", u"\uFFFD\uFFFD\uFFFD\uFFFD"},  // above U+10FFFF
        {"\xE2\x82", u"\uFFFD"},                            // truncated at the end
        {"\xF0\x9F\x98", u"\uFFFD"},                        // truncated four-byte form
    };
    for (const auto& [in, out] : invalid) {
        EXPECT_EQ(Str(BStr(in).Get()), out) << ::testing::PrintToString(in);
    }
    const std::string fffd = "\xEF\xBF\xBD";
    const OLECHAR lone[] = {0xD800, u'x', 0xDC00, 0xDC00, 0xD800, 0xD83D};
    EXPECT_EQ(BStr::Attach(SysAllocStringLen(lone, 6)).Utf8(),
              fffd + "x" + fffd + fffd + fffd + fffd);
}

TEST(ComVariant, CopiesOwnTheirValues) {
    VARIANT src = Var(VT_BSTR);
    src.bstrVal = SysAllocString(u"payload");
    VARIANT dst = Var(VT_BSTR);
    dst.bstrVal = SysAllocString(u"overwritten");  // VariantCopy must free this
    ASSERT_EQ(VariantCopy(&dst, &src), S_OK);
    EXPECT_EQ(V_VT(&dst), VT_BSTR);
    EXPECT_NE(V_BSTR(&dst), V_BSTR(&src));
    EXPECT_EQ(VariantClear(&src), S_OK);
    EXPECT_EQ(src.vt, VT_EMPTY);
    EXPECT_EQ(Str(dst.bstrVal), u"payload");  // alive after the source is gone
    EXPECT_EQ(VariantClear(&dst), S_OK);

    Counting obj;
    for (VARTYPE vt : {VARTYPE{VT_UNKNOWN}, VARTYPE{VT_DISPATCH}}) {
        VARIANT v = Var(vt);
        v.punkVal = static_cast<IUnknown*>(&obj);
        if (vt == VT_DISPATCH) {
            v.pdispVal = &obj;
        }
        obj.AddRef();  // the reference v owns
        VARIANT copy = Var();
        EXPECT_EQ(Refs({obj.After(VariantCopy(&copy, &v)), obj.After(VariantClear(&copy)),
                        obj.After(VariantClear(&v))}),
                  Refs({3, 2, 1}));
    }

    BSTR owned = SysAllocString(u"mine");  // by reference: neither freed nor deep-copied
    VARIANT ref = Var(VT_BYREF | VT_BSTR);
    ref.byref = &owned;
    VARIANT copy = Var();
    EXPECT_EQ(Results({VariantCopy(&copy, &ref), VariantClear(&copy), VariantClear(&ref)}),
              Results(3, S_OK));
    EXPECT_EQ(Str(owned), u"mine");
    SysFreeString(owned);

    EXPECT_EQ(
        Results({VariantClear(nullptr), VariantCopy(nullptr, &copy), VariantCopy(&copy, nullptr)}),
        Results(3, E_INVALIDARG));
    for (VARTYPE vt : {VARTYPE{VT_VARIANT}, VARTYPE{0x0FFF}, VARTYPE{VT_BYREF | VT_EMPTY},
                       VARTYPE{0x1000 | VT_I4}}) {
        VARIANT bad = Var(vt);
        EXPECT_EQ(Results({VariantClear(&bad), VariantCopy(&copy, &bad)}),
                  Results(2, DISP_E_BADVARTYPE))
            << vt;
    }
}

TEST(ComVariant, ArrayCopyIsIndependentAndLockedArrayIsKept) {
    VARIANT v = Var(VT_ARRAY | VT_BSTR);
    v.parray = MakeBstrArray({"a", "b"});
    ASSERT_NE(v.parray, nullptr);
    VARIANT copy = Var();
    ASSERT_EQ(VariantCopy(&copy, &v), S_OK);
    LONG index = 1;
    ASSERT_EQ(SafeArrayPutElement(copy.parray, &index, BStr("changed").Get()), S_OK);
    BSTR item = nullptr;
    ASSERT_EQ(SafeArrayGetElement(v.parray, &index, &item), S_OK);
    EXPECT_EQ(Str(BStr::Attach(item).Get()), u"b");

    ASSERT_EQ(SafeArrayLock(v.parray), S_OK);
    EXPECT_EQ(VariantClear(&v), DISP_E_ARRAYISLOCKED);
    EXPECT_EQ(v.vt, VT_ARRAY | VT_BSTR);
    EXPECT_EQ(Results({SafeArrayUnlock(v.parray), VariantClear(&v), VariantClear(&copy)}),
              Results(3, S_OK));
}

// A BSTR vector with bounds 5..7.
class ComSafeArray : public ::testing::Test {
  protected:
    void SetUp() override { ASSERT_NE(psa, nullptr); }
    void TearDown() override { EXPECT_EQ(SafeArrayDestroy(psa), S_OK); }
    std::u16string Get(LONG index, SAFEARRAY* from = nullptr) {
        BSTR b = nullptr;
        EXPECT_EQ(SafeArrayGetElement(from ? from : psa, &index, &b), S_OK);
        return Str(BStr::Attach(b).Get());
    }
    HRESULT Put(LONG index, const char* s, SAFEARRAY* to = nullptr) {
        return SafeArrayPutElement(to ? to : psa, &index, s ? BStr(s).Get() : nullptr);
    }
    SAFEARRAY* psa = SafeArrayCreateVector(VT_BSTR, 5, 3);
};

TEST_F(ComSafeArray, ShapeBoundsAndIndexChecks) {
    LONG lb = 0;
    LONG ub = 0;
    EXPECT_EQ(std::make_pair(SafeArrayGetDim(psa), SafeArrayGetElemsize(psa)),
              std::make_pair(1u, static_cast<UINT>(sizeof(BSTR))));
    EXPECT_EQ(Results({SafeArrayGetLBound(psa, 1, &lb), SafeArrayGetUBound(psa, 1, &ub)}),
              Results(2, S_OK));
    EXPECT_EQ(std::make_pair(lb, ub), std::make_pair(LONG{5}, LONG{7}));
    EXPECT_NE(psa->fFeatures & FADF_BSTR, 0);
    EXPECT_EQ(Get(6), u"");  // elements start out null

    BSTR b = nullptr;
    LONG index[] = {4, 8, 5};
    EXPECT_EQ(Results({SafeArrayGetLBound(psa, 0, &lb), SafeArrayGetUBound(psa, 2, &ub),
                       SafeArrayGetElement(psa, &index[0], &b), Put(4, "x"),
                       SafeArrayGetElement(psa, &index[1], &b), Put(8, "x")}),
              Results(6, DISP_E_BADINDEX));
    EXPECT_EQ(b, nullptr);
    EXPECT_EQ(Results({SafeArrayGetElement(psa, &index[2], nullptr),
                       SafeArrayGetElement(psa, nullptr, &b)}),
              Results(2, E_INVALIDARG));

    // 32-bit index arithmetic would wrap INT_MIN - INT_MAX to 1, which looks in range.
    constexpr LONG kMax = 2147483647;
    SAFEARRAY* edge = SafeArrayCreateVector(VT_I4, kMax, 2);
    ASSERT_NE(edge, nullptr);
    LONG value = 0;
    LONG first = kMax;
    LONG wrapped = -kMax - 1;
    EXPECT_EQ(Results({SafeArrayGetElement(edge, &first, &value),
                       SafeArrayGetElement(edge, &wrapped, &value),
                       SafeArrayPutElement(edge, &wrapped, &value), SafeArrayDestroy(edge)}),
              Results({S_OK, DISP_E_BADINDEX, DISP_E_BADINDEX, S_OK}));
}

TEST_F(ComSafeArray, GetCopiesAndPutReplaces) {
    LONG index = 6;
    BStr value("first");
    ASSERT_EQ(SafeArrayPutElement(psa, &index, value.Get()), S_OK);
    BSTR got = nullptr;
    ASSERT_EQ(SafeArrayGetElement(psa, &index, &got), S_OK);
    BSTR* data = nullptr;
    ASSERT_EQ(SafeArrayAccessData(psa, reinterpret_cast<void**>(&data)), S_OK);
    EXPECT_NE(got, value.Get());
    EXPECT_NE(got, data[1]);
    EXPECT_EQ(Str(BStr::Attach(got).Get()), u"first");
    // Putting the stored string back onto itself must copy before freeing.
    ASSERT_EQ(SafeArrayPutElement(psa, &index, data[1]), S_OK);
    ASSERT_EQ(SafeArrayUnaccessData(psa), S_OK);
    EXPECT_EQ(Get(6), u"first");
    ASSERT_EQ(Put(6, "second"), S_OK);
    EXPECT_EQ(std::make_pair(Get(6), Get(5)),
              std::make_pair(std::u16string(u"second"), std::u16string()));
    ASSERT_EQ(Put(6, nullptr), S_OK);
    EXPECT_EQ(Get(6), u"");
}

TEST_F(ComSafeArray, LockingBlocksDestroyAndCopyIsIndependent) {
    void* data = nullptr;
    EXPECT_EQ(Results({SafeArrayLock(psa), SafeArrayAccessData(psa, &data), SafeArrayDestroy(psa),
                       Put(5, "original"), SafeArrayUnaccessData(psa), SafeArrayDestroy(psa),
                       SafeArrayUnlock(psa), SafeArrayUnlock(psa)}),
              Results({S_OK, S_OK, DISP_E_ARRAYISLOCKED, S_OK, S_OK, DISP_E_ARRAYISLOCKED, S_OK,
                       E_UNEXPECTED}));
    EXPECT_EQ(data, psa->pvData);

    SAFEARRAY* copy = nullptr;
    ASSERT_EQ(SafeArrayCopy(psa, &copy), S_OK);
    ASSERT_NE(copy, nullptr);
    EXPECT_NE(static_cast<BSTR*>(copy->pvData)[0], static_cast<BSTR*>(psa->pvData)[0]);
    EXPECT_EQ(std::make_pair(copy->rgsabound[0].lLbound, copy->rgsabound[0].cElements),
              std::make_pair(LONG{5}, ULONG{3}));
    VARTYPE vt = VT_EMPTY;
    EXPECT_EQ(SafeArrayGetVartype(copy, &vt), S_OK);
    EXPECT_EQ(vt, VT_BSTR);
    EXPECT_EQ(Get(5, copy), u"original");
    EXPECT_EQ(Results({Put(5, "changed", copy), SafeArrayDestroy(copy)}), Results(2, S_OK));
    EXPECT_EQ(Get(5), u"original");
}

TEST(ComSafeArrayTypes, InterfaceElementsAreCounted) {
    Counting unk;
    IUnknown* const p = &unk;
    SAFEARRAY* psa = SafeArrayCreateVector(VT_UNKNOWN, 0, 2);
    ASSERT_NE(psa, nullptr);
    LONG index = 1;
    IUnknown* got = nullptr;
    SAFEARRAY* copy = nullptr;
    const auto release = [&] { return got ? got->Release() : 0; };
    EXPECT_EQ(
        Refs({unk.After(SafeArrayPutElement(psa, &index, p)),
              unk.After(SafeArrayGetElement(psa, &index, &got)),
              (release(), unk.After(SafeArrayCopy(psa, &copy))), unk.After(SafeArrayDestroy(copy)),
              unk.After(SafeArrayPutElement(psa, &index, nullptr)),
              unk.After(SafeArrayPutElement(psa, &index, p)), unk.After(SafeArrayDestroy(psa))}),
        Refs({2, 3, 3, 2, 1, 2, 1}));
    EXPECT_EQ(got, p);
}

TEST(ComSafeArrayTypes, VariantAndScalarElements) {
    SAFEARRAY* variants = SafeArrayCreateVector(VT_VARIANT, -1, 2);
    ASSERT_NE(variants, nullptr);
    VARIANT v = Var(VT_BSTR);
    v.bstrVal = SysAllocString(u"inside");
    LONG index = 0;
    VARIANT got;
    ASSERT_EQ(Results({SafeArrayPutElement(variants, &index, &v),
                       SafeArrayGetElement(variants, &index, &got)}),
              Results(2, S_OK));
    EXPECT_NE(got.bstrVal, v.bstrVal);
    EXPECT_EQ(Str(got.bstrVal), u"inside");
    // Destroy frees the stored copy.
    EXPECT_EQ(Results({VariantClear(&got), VariantClear(&v), SafeArrayDestroy(variants)}),
              Results(3, S_OK));

    SAFEARRAYBOUND bound{4, -2};
    SAFEARRAY* ints = SafeArrayCreate(VT_I4, 1, &bound);
    ASSERT_NE(ints, nullptr);
    LONG value = -123456;
    LONG out = 0;
    index = 1;
    EXPECT_EQ(Results({SafeArrayPutElement(ints, &index, &value),
                       SafeArrayPutElement(ints, &index, nullptr),
                       SafeArrayGetElement(ints, &index, &out)}),
              Results({S_OK, E_INVALIDARG, S_OK}));
    EXPECT_EQ(std::make_pair(out, static_cast<LONG*>(ints->pvData)[3]),
              std::make_pair(value, value));
    EXPECT_EQ(SafeArrayDestroy(ints), S_OK);
}

TEST(ComErrorInfo, TheThreadsErrorInfoIsHandedOverOnce) {
    ComPtr<ICreateErrorInfo> create;
    ASSERT_EQ(CreateErrorInfo(create.GetAddressOf()), S_OK);
    OLECHAR description[] = OLESTR("Out of memory");
    ASSERT_EQ(create->SetDescription(description), S_OK);
    ComPtr<IErrorInfo> set;
    ASSERT_EQ(create->QueryInterface(IID_IErrorInfo, set.GetVoidAddressOf()), S_OK);
    ASSERT_EQ(SetErrorInfo(0, set.Get()), S_OK);
    IErrorInfo* got = nullptr;
    std::thread([&] { EXPECT_EQ(GetErrorInfo(0, &got), S_FALSE); }).join();  // per thread
    ASSERT_EQ(GetErrorInfo(0, &got), S_OK);
    const ComPtr<IErrorInfo> taken = ComPtr<IErrorInfo>::Attach(got);
    EXPECT_EQ(taken.Get(), set.Get());
    BStr text;
    ASSERT_EQ(taken->GetDescription(text.Out()), S_OK);
    EXPECT_EQ(text.Utf8(), "Out of memory");
    EXPECT_EQ(GetErrorInfo(0, &got), S_FALSE) << "taken once";
    EXPECT_EQ(got, nullptr);
}

}  // namespace
