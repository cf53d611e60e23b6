#include "nqportmanager/com.h"

#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <utility>

namespace {

std::u16string Str(BSTR b) {
    return std::u16string(BstrView(b));
}

class CountingUnknown final : public IUnknown {
  public:
    HRESULT QueryInterface(REFIID, void** ppv) override {
        *ppv = nullptr;
        return E_NOINTERFACE;
    }
    ULONG AddRef() override { return ++refs; }
    ULONG Release() override { return --refs; }
    ULONG refs = 1;
};

class CountingDispatch final : public IDispatch {
  public:
    HRESULT QueryInterface(REFIID, void** ppv) override {
        *ppv = nullptr;
        return E_NOINTERFACE;
    }
    ULONG AddRef() override { return ++refs; }
    ULONG Release() override { return --refs; }
    HRESULT GetTypeInfoCount(UINT*) override { return E_NOTIMPL; }
    HRESULT GetTypeInfo(UINT, LCID, ITypeInfo**) override { return E_NOTIMPL; }
    HRESULT GetIDsOfNames(REFIID, LPOLESTR*, UINT, LCID, DISPID*) override { return E_NOTIMPL; }
    HRESULT Invoke(DISPID, REFIID, LCID, WORD, DISPPARAMS*, VARIANT*, EXCEPINFO*, UINT*) override {
        return E_NOTIMPL;
    }
    ULONG refs = 1;
};

// ---- HRESULT -------------------------------------------------------------------------------

TEST(ComHresult, ConstantsMatchWindowsBitPatterns) {
    const std::pair<HRESULT, uint32_t> table[] = {{E_NOTIMPL, 0x80004001u},
                                                  {E_NOINTERFACE, 0x80004002u},
                                                  {E_POINTER, 0x80004003u},
                                                  {E_ABORT, 0x80004004u},
                                                  {E_FAIL, 0x80004005u},
                                                  {E_UNEXPECTED, 0x8000FFFFu},
                                                  {E_ACCESSDENIED, 0x80070005u},
                                                  {E_HANDLE, 0x80070006u},
                                                  {E_OUTOFMEMORY, 0x8007000Eu},
                                                  {E_INVALIDARG, 0x80070057u},
                                                  {CLASS_E_NOAGGREGATION, 0x80040110u},
                                                  {CLASS_E_CLASSNOTAVAILABLE, 0x80040111u},
                                                  {CONNECT_E_NOCONNECTION, 0x80040200u},
                                                  {CONNECT_E_ADVISELIMIT, 0x80040201u},
                                                  {CONNECT_E_CANNOTCONNECT, 0x80040202u},
                                                  {DISP_E_MEMBERNOTFOUND, 0x80020003u},
                                                  {DISP_E_TYPEMISMATCH, 0x80020005u},
                                                  {DISP_E_BADVARTYPE, 0x80020008u},
                                                  {DISP_E_BADINDEX, 0x8002000Bu},
                                                  {DISP_E_ARRAYISLOCKED, 0x8002000Du},
                                                  {TYPE_E_ELEMENTNOTFOUND, 0x8002802Bu}};
    for (const auto& [hr, bits] : table) {
        EXPECT_EQ(static_cast<uint32_t>(hr), bits);
        EXPECT_TRUE(FAILED(hr)) << std::hex << bits;
        EXPECT_FALSE(SUCCEEDED(hr)) << std::hex << bits;
    }
    EXPECT_TRUE(SUCCEEDED(S_OK));
    EXPECT_TRUE(SUCCEEDED(S_FALSE));
    EXPECT_NE(S_OK, S_FALSE);
}

TEST(ComHresult, FromWin32MapsErrorCodes) {
    static_assert(HRESULT_FROM_WIN32(0) == S_OK);
    EXPECT_EQ(HRESULT_FROM_WIN32(5), E_ACCESSDENIED);  // ERROR_ACCESS_DENIED
    EXPECT_EQ(HRESULT_FROM_WIN32(6), E_HANDLE);        // ERROR_INVALID_HANDLE
    EXPECT_EQ(HRESULT_FROM_WIN32(14), E_OUTOFMEMORY);  // ERROR_OUTOFMEMORY
    EXPECT_EQ(HRESULT_FROM_WIN32(87), E_INVALIDARG);   // ERROR_INVALID_PARAMETER
    EXPECT_EQ(static_cast<uint32_t>(HRESULT_FROM_WIN32(0x00012345u)), 0x80072345u);
    // Already an HRESULT: winerror.h passes it through.
    EXPECT_EQ(HRESULT_FROM_WIN32(static_cast<uint32_t>(E_FAIL)), E_FAIL);
}

// ---- GUID ----------------------------------------------------------------------------------

TEST(ComGuid, LiteralsStringsAndEquality) {
    constexpr GUID g = MakeGuid("00020400-0000-0000-C000-000000000046");
    EXPECT_EQ(g.Data1, 0x00020400u);
    EXPECT_EQ(g.Data2, 0u);
    EXPECT_EQ(g.Data4[0], 0xC0);
    EXPECT_EQ(g.Data4[7], 0x46);
    EXPECT_EQ(g, IID_IDispatch);
    EXPECT_EQ(GuidToString(IID_IConnectionPoint), "{B196B286-BAB4-101A-B69C-00AA00341D07}");
    EXPECT_EQ(GuidToString(GUID_NULL), "{00000000-0000-0000-0000-000000000000}");

    for (const GUID& g :
         {IID_IUnknown, IID_IDispatch, IID_IConnectionPointContainer, IID_IConnectionPoint,
          IID_ISupportErrorInfo, IID_IEnumConnections, IID_IEnumConnectionPoints}) {
        GUID parsed{};
        ASSERT_TRUE(GuidFromString(GuidToString(g), &parsed));
        EXPECT_TRUE(IsEqualIID(parsed, g));
    }
    GUID almost = IID_IConnectionPoint;
    almost.Data4[7] ^= 1;
    EXPECT_FALSE(IsEqualGUID(almost, IID_IConnectionPoint));
}

TEST(ComGuid, ParserFormsAndRejects) {
    GUID g{};
    ASSERT_TRUE(GuidFromString("df0b3d60-548f-101b-8E65-08002b2bd119", &g));
    EXPECT_EQ(g, IID_ISupportErrorInfo);
    ASSERT_TRUE(GuidFromString("{DF0B3D60-548F-101B-8E65-08002B2BD119}", &g));
    EXPECT_EQ(g, IID_ISupportErrorInfo);

    const char* bad[] = {"",
                         "{DF0B3D60-548F-101B-8E65-08002B2BD119",
                         "DF0B3D60-548F-101B-8E65-08002B2BD119}",
                         "DF0B3D60-548F-101B-8E65-08002B2BD11",
                         "DF0B3D60-548F-101B-8E65-08002B2BD1190",
                         "DF0B3D60-548F-101B-8E6508-002B2BD119",
                         "DF0B3D6G-548F-101B-8E65-08002B2BD119",
                         " DF0B3D60-548F-101B-8E65-08002B2BD119 "};
    for (const char* text : bad) {
        GUID untouched = IID_IUnknown;
        EXPECT_FALSE(GuidFromString(text, &untouched)) << text;
        EXPECT_EQ(untouched, IID_IUnknown) << text;
    }
    EXPECT_FALSE(GuidFromString("DF0B3D60-548F-101B-8E65-08002B2BD119", nullptr));
}

// ---- BSTR ----------------------------------------------------------------------------------

TEST(ComBstr, LengthPrefixAndTerminator) {
    BSTR b = SysAllocString(u"abc");
    ASSERT_NE(b, nullptr);
    uint32_t prefix = 0;
    std::memcpy(&prefix, reinterpret_cast<const char*>(b) - sizeof(prefix), sizeof(prefix));
    EXPECT_EQ(prefix, 6u);
    EXPECT_EQ(SysStringByteLen(b), 6u);
    EXPECT_EQ(SysStringLen(b), 3u);
    EXPECT_EQ(b[3], u'\0');
    EXPECT_EQ(Str(b), u"abc");
    SysFreeString(b);

    BSTR empty = SysAllocString(u"");
    ASSERT_NE(empty, nullptr);  // empty is not null
    EXPECT_EQ(SysStringLen(empty), 0u);
    EXPECT_EQ(empty[0], u'\0');
    SysFreeString(empty);
}

TEST(ComBstr, ExplicitLengthsKeepEmbeddedZeros) {
    const OLECHAR src[] = {u'a', u'\0', u'b'};
    BSTR b = SysAllocStringLen(src, 3);
    EXPECT_EQ(SysStringLen(b), 3u);
    EXPECT_EQ(Str(b), std::u16string(src, 3));
    EXPECT_EQ(b[3], u'\0');
    SysFreeString(b);

    BSTR zeroed = SysAllocStringLen(nullptr, 4);
    ASSERT_NE(zeroed, nullptr);
    EXPECT_EQ(Str(zeroed), std::u16string(4, u'\0'));
    SysFreeString(zeroed);

    BSTR bytes = SysAllocStringByteLen("xyz", 3);
    ASSERT_NE(bytes, nullptr);
    EXPECT_EQ(SysStringByteLen(bytes), 3u);
    EXPECT_EQ(SysStringLen(bytes), 1u);
    const char* raw = reinterpret_cast<const char*>(bytes);
    EXPECT_EQ(std::string(raw, 3), "xyz");
    EXPECT_EQ(raw[3], '\0');
    EXPECT_EQ(raw[4], '\0');
    SysFreeString(bytes);

    // A character count whose byte count cannot fit the 4-byte prefix.
    EXPECT_EQ(SysAllocStringLen(nullptr, 0x80000000u), nullptr);
}

TEST(ComBstr, NullHandling) {
    EXPECT_EQ(SysAllocString(nullptr), nullptr);
    EXPECT_EQ(SysStringLen(nullptr), 0u);
    EXPECT_EQ(SysStringByteLen(nullptr), 0u);
    SysFreeString(nullptr);
    EXPECT_FALSE(SysReAllocString(nullptr, u"x"));
    EXPECT_FALSE(SysReAllocStringLen(nullptr, u"x", 1));
    EXPECT_TRUE(BstrView(nullptr).empty());
    EXPECT_EQ(Utf8FromBstr(nullptr), "");

    BSTR b = nullptr;
    ASSERT_TRUE(SysReAllocString(&b, u"from null"));
    EXPECT_EQ(Str(b), u"from null");
    ASSERT_TRUE(SysReAllocString(&b, nullptr));
    EXPECT_EQ(b, nullptr);
}

TEST(ComBstr, ReAllocReplacesAndMayAlias) {
    BSTR b = SysAllocString(u"hello");
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
    SysFreeString(b);
}

// ---- UTF-8 ---------------------------------------------------------------------------------

TEST(ComUtf8, RoundTripIncludingSurrogatePairs) {
    const std::string utf8 = "a\xC3\xA9\xE2\x82\xAC\xF0\x9F\x98\x80";  // a é € U+1F600
    BStr b(utf8);
    EXPECT_EQ(Str(b.Get()), u"a\u00E9\u20AC\U0001F600");
    EXPECT_EQ(b.Length(), 5u);  // the emoji takes two UTF-16 units
    EXPECT_EQ(b.Utf8(), utf8);

    BStr withNul(std::string_view("a\0b", 3));
    EXPECT_EQ(withNul.Length(), 3u);
    EXPECT_EQ(withNul.Utf8(), std::string("a\0b", 3));

    BStr empty(std::string_view{});
    EXPECT_FALSE(empty.IsNull());
    EXPECT_EQ(empty.Length(), 0u);
}

TEST(ComUtf8, InvalidBytesBecomeReplacementCharacters) {
    const struct {
        std::string in;
        std::u16string out;
    } cases[] = {
        {"\xFF", u"\uFFFD"},
        {"a\x80"
         "b",
         u"a\uFFFDb"},
        {"\xC0\xAF", u"\uFFFD\uFFFD"},                      // overlong '/'
        {"\xE0\x80\xAF", u"\uFFFD\uFFFD\uFFFD"},            // overlong, three bytes
        {"\xED\xA0\x80", u"\uFFFD\uFFFD\uFFFD"},            // encoded surrogate
        {"\xF4\x90\x80\x80", u"\uFFFD\uFFFD\uFFFD\uFFFD"},  // above U+10FFFF
        {"\xE2\x82", u"\uFFFD"},                            // truncated at the end
        {"\xE2\x82x", u"\uFFFDx"},                          // truncated before ASCII
        {"\xF0\x9F\x98", u"\uFFFD"},                        // truncated four-byte form
    };
    for (const auto& c : cases) {
        BSTR b = BstrFromUtf8(c.in);
        ASSERT_NE(b, nullptr);
        EXPECT_EQ(Str(b), c.out) << ::testing::PrintToString(c.in);
        SysFreeString(b);
    }
}

TEST(ComUtf8, UnpairedSurrogatesBecomeReplacementCharacters) {
    const std::string fffd = "\xEF\xBF\xBD";
    const OLECHAR lone[] = {0xD800, u'x', 0xDC00, 0xDC00, 0xD800, 0xD83D};
    BSTR b = SysAllocStringLen(lone, 6);
    EXPECT_EQ(Utf8FromBstr(b), fffd + "x" + fffd + fffd + fffd + fffd);
    SysFreeString(b);
}

// ---- BStr ----------------------------------------------------------------------------------

TEST(ComBStrOwner, MoveDetachAttach) {
    BStr a("first");
    const BSTR raw = a.Get();
    BStr b(std::move(a));
    EXPECT_TRUE(a.IsNull());
    EXPECT_EQ(b.Get(), raw);

    BStr c("second");
    c = std::move(b);  // "second" must be freed here
    EXPECT_EQ(c.Get(), raw);
    EXPECT_TRUE(b.IsNull());

    BSTR detached = c.Detach();
    EXPECT_TRUE(c.IsNull());
    EXPECT_EQ(detached, raw);
    BStr owner = BStr::Attach(detached);  // freed when owner goes away
    EXPECT_EQ(owner.Utf8(), "first");

    BStr none(static_cast<const OLECHAR*>(nullptr));
    EXPECT_TRUE(none.IsNull());
    EXPECT_EQ(none.Length(), 0u);
    EXPECT_EQ(none.Copy(), nullptr);
}

TEST(ComBStrOwner, OutFreesPreviousAndCopyIsDistinct) {
    BStr s("old value");
    BSTR* out = s.Out();
    ASSERT_NE(out, nullptr);
    EXPECT_EQ(*out, nullptr);
    EXPECT_TRUE(s.IsNull());
    *out = SysAllocString(u"new value");
    EXPECT_EQ(s.Utf8(), "new value");

    BSTR copy = s.Copy();
    ASSERT_NE(copy, nullptr);
    EXPECT_NE(copy, s.Get());
    EXPECT_EQ(Str(copy), Str(s.Get()));
    SysFreeString(copy);
}

// ---- VARIANT -------------------------------------------------------------------------------

TEST(ComVariant, BstrCopyIsDeepAndClearFrees) {
    VARIANT src;
    VariantInit(&src);
    EXPECT_EQ(src.vt, VT_EMPTY);
    src.vt = VT_BSTR;
    src.bstrVal = SysAllocString(u"payload");

    VARIANT dst;
    VariantInit(&dst);
    dst.vt = VT_BSTR;
    dst.bstrVal = SysAllocString(u"overwritten");  // VariantCopy must free this
    ASSERT_EQ(VariantCopy(&dst, &src), S_OK);
    EXPECT_EQ(V_VT(&dst), VT_BSTR);
    EXPECT_NE(V_BSTR(&dst), V_BSTR(&src));
    EXPECT_EQ(Str(dst.bstrVal), u"payload");

    EXPECT_EQ(VariantClear(&src), S_OK);
    EXPECT_EQ(src.vt, VT_EMPTY);
    EXPECT_EQ(Str(dst.bstrVal), u"payload");  // still alive after the source is gone
    EXPECT_EQ(VariantClear(&dst), S_OK);
}

TEST(ComVariant, InterfacesAreAddRefedAndReleased) {
    CountingUnknown unk;
    VARIANT v;
    VariantInit(&v);
    v.vt = VT_UNKNOWN;
    v.punkVal = &unk;
    unk.AddRef();  // the reference v owns

    VARIANT copy;
    VariantInit(&copy);
    ASSERT_EQ(VariantCopy(&copy, &v), S_OK);
    EXPECT_EQ(V_UNKNOWN(&copy), &unk);
    EXPECT_EQ(unk.refs, 3u);
    EXPECT_EQ(VariantClear(&copy), S_OK);
    EXPECT_EQ(unk.refs, 2u);
    EXPECT_EQ(VariantClear(&v), S_OK);
    EXPECT_EQ(unk.refs, 1u);

    CountingDispatch disp;
    v.vt = VT_DISPATCH;
    v.pdispVal = &disp;
    disp.AddRef();
    ASSERT_EQ(VariantCopy(&copy, &v), S_OK);
    EXPECT_EQ(disp.refs, 3u);
    EXPECT_EQ(VariantClear(&copy), S_OK);
    EXPECT_EQ(VariantClear(&v), S_OK);
    EXPECT_EQ(disp.refs, 1u);
}

TEST(ComVariant, ByrefIsNeitherFreedNorDeepCopied) {
    BSTR owned = SysAllocString(u"mine");
    VARIANT v;
    VariantInit(&v);
    v.vt = VT_BYREF | VT_BSTR;
    v.byref = &owned;
    VARIANT copy;
    VariantInit(&copy);
    ASSERT_EQ(VariantCopy(&copy, &v), S_OK);
    EXPECT_EQ(copy.byref, &owned);
    EXPECT_EQ(VariantClear(&copy), S_OK);
    EXPECT_EQ(VariantClear(&v), S_OK);
    EXPECT_EQ(Str(owned), u"mine");
    SysFreeString(owned);
}

TEST(ComVariant, RejectsBadArguments) {
    VARIANT v;
    VariantInit(&v);
    EXPECT_EQ(VariantClear(nullptr), E_INVALIDARG);
    EXPECT_EQ(VariantCopy(nullptr, &v), E_INVALIDARG);
    EXPECT_EQ(VariantCopy(&v, nullptr), E_INVALIDARG);

    VARIANT bad;
    VariantInit(&bad);
    for (VARTYPE vt : {VARTYPE{VT_VARIANT}, VARTYPE{0x0FFF}, VARTYPE{VT_BYREF | VT_EMPTY},
                       VARTYPE{0x1000 | VT_I4}}) {
        bad.vt = vt;
        EXPECT_EQ(VariantClear(&bad), DISP_E_BADVARTYPE) << vt;
        EXPECT_EQ(VariantCopy(&v, &bad), DISP_E_BADVARTYPE) << vt;
    }
}

TEST(ComVariant, ArrayCopyIsIndependentAndLockedArrayIsKept) {
    VARIANT v;
    VariantInit(&v);
    v.vt = VT_ARRAY | VT_BSTR;
    v.parray = MakeBstrArray({"a", "b"});
    ASSERT_NE(v.parray, nullptr);

    VARIANT copy;
    VariantInit(&copy);
    ASSERT_EQ(VariantCopy(&copy, &v), S_OK);
    ASSERT_NE(V_ARRAY(&copy), V_ARRAY(&v));
    LONG index = 1;
    ASSERT_EQ(SafeArrayPutElement(copy.parray, &index, BStr("changed").Get()), S_OK);
    BSTR item = nullptr;
    ASSERT_EQ(SafeArrayGetElement(v.parray, &index, &item), S_OK);
    EXPECT_EQ(Str(item), u"b");
    SysFreeString(item);

    ASSERT_EQ(SafeArrayLock(v.parray), S_OK);
    EXPECT_EQ(VariantClear(&v), DISP_E_ARRAYISLOCKED);
    EXPECT_EQ(v.vt, VT_ARRAY | VT_BSTR);
    ASSERT_EQ(SafeArrayUnlock(v.parray), S_OK);
    EXPECT_EQ(VariantClear(&v), S_OK);
    EXPECT_EQ(VariantClear(&copy), S_OK);
}

// ---- SAFEARRAY -----------------------------------------------------------------------------

class ComSafeArray : public ::testing::Test {
  protected:
    void SetUp() override {
        psa = SafeArrayCreateVector(VT_BSTR, 5, 3);
        ASSERT_NE(psa, nullptr);
    }
    void TearDown() override { EXPECT_EQ(SafeArrayDestroy(psa), S_OK); }

    std::u16string Get(LONG index) {
        BSTR b = nullptr;
        EXPECT_EQ(SafeArrayGetElement(psa, &index, &b), S_OK);
        std::u16string s = Str(b);
        SysFreeString(b);
        return s;
    }

    SAFEARRAY* psa = nullptr;
};

TEST_F(ComSafeArray, BoundsAndShape) {
    LONG lb = 0;
    LONG ub = 0;
    EXPECT_EQ(SafeArrayGetDim(psa), 1u);
    EXPECT_EQ(SafeArrayGetElemsize(psa), sizeof(BSTR));
    ASSERT_EQ(SafeArrayGetLBound(psa, 1, &lb), S_OK);
    ASSERT_EQ(SafeArrayGetUBound(psa, 1, &ub), S_OK);
    EXPECT_EQ(lb, 5);
    EXPECT_EQ(ub, 7);
    EXPECT_EQ(SafeArrayGetLBound(psa, 0, &lb), DISP_E_BADINDEX);
    EXPECT_EQ(SafeArrayGetUBound(psa, 2, &ub), DISP_E_BADINDEX);
    VARTYPE vt = VT_EMPTY;
    ASSERT_EQ(SafeArrayGetVartype(psa, &vt), S_OK);
    EXPECT_EQ(vt, VT_BSTR);
    EXPECT_NE(psa->fFeatures & FADF_BSTR, 0);
    EXPECT_EQ(Get(6), u"");  // elements start out null
}

TEST_F(ComSafeArray, GetCopiesAndPutReplaces) {
    LONG index = 6;
    BStr value("first");
    ASSERT_EQ(SafeArrayPutElement(psa, &index, value.Get()), S_OK);
    BSTR got = nullptr;
    ASSERT_EQ(SafeArrayGetElement(psa, &index, &got), S_OK);
    EXPECT_NE(got, value.Get());
    BSTR* data = nullptr;
    ASSERT_EQ(SafeArrayAccessData(psa, reinterpret_cast<void**>(&data)), S_OK);
    EXPECT_NE(got, data[1]);
    EXPECT_EQ(Str(got), u"first");
    SysFreeString(got);

    // Putting the stored string back onto itself must copy before freeing.
    ASSERT_EQ(SafeArrayPutElement(psa, &index, data[1]), S_OK);
    ASSERT_EQ(SafeArrayUnaccessData(psa), S_OK);
    EXPECT_EQ(Get(6), u"first");

    ASSERT_EQ(SafeArrayPutElement(psa, &index, BStr("second").Get()), S_OK);
    EXPECT_EQ(Get(6), u"second");
    EXPECT_EQ(Get(5), u"");
    ASSERT_EQ(SafeArrayPutElement(psa, &index, nullptr), S_OK);
    EXPECT_EQ(Get(6), u"");
}

TEST_F(ComSafeArray, OutOfRangeIndexIsRejected) {
    BSTR b = nullptr;
    for (LONG index : {LONG{4}, LONG{8}}) {
        EXPECT_EQ(SafeArrayGetElement(psa, &index, &b), DISP_E_BADINDEX) << index;
        EXPECT_EQ(SafeArrayPutElement(psa, &index, BStr("x").Get()), DISP_E_BADINDEX) << index;
    }
    EXPECT_EQ(b, nullptr);

    // 32-bit index arithmetic would wrap INT_MIN - INT_MAX to 1, which looks in range.
    constexpr LONG kMax = 2147483647;
    SAFEARRAY* edge = SafeArrayCreateVector(VT_I4, kMax, 2);
    ASSERT_NE(edge, nullptr);
    LONG value = 0;
    LONG first = kMax;
    LONG wrapped = -kMax - 1;
    EXPECT_EQ(SafeArrayGetElement(edge, &first, &value), S_OK);
    EXPECT_EQ(SafeArrayGetElement(edge, &wrapped, &value), DISP_E_BADINDEX);
    EXPECT_EQ(SafeArrayPutElement(edge, &wrapped, &value), DISP_E_BADINDEX);
    EXPECT_EQ(SafeArrayDestroy(edge), S_OK);
    LONG index = 5;
    EXPECT_EQ(SafeArrayGetElement(psa, &index, nullptr), E_INVALIDARG);
    EXPECT_EQ(SafeArrayGetElement(psa, nullptr, &b), E_INVALIDARG);
}

TEST_F(ComSafeArray, LockingBlocksDestroy) {
    ASSERT_EQ(SafeArrayLock(psa), S_OK);
    void* data = nullptr;
    ASSERT_EQ(SafeArrayAccessData(psa, &data), S_OK);
    EXPECT_EQ(data, psa->pvData);
    EXPECT_EQ(SafeArrayDestroy(psa), DISP_E_ARRAYISLOCKED);
    LONG index = 7;
    EXPECT_EQ(SafeArrayPutElement(psa, &index, BStr("allowed").Get()), S_OK);
    EXPECT_EQ(SafeArrayUnaccessData(psa), S_OK);
    EXPECT_EQ(SafeArrayDestroy(psa), DISP_E_ARRAYISLOCKED);
    EXPECT_EQ(SafeArrayUnlock(psa), S_OK);
    EXPECT_EQ(SafeArrayUnlock(psa), E_UNEXPECTED);
    EXPECT_EQ(Get(7), u"allowed");
}

TEST_F(ComSafeArray, CopyIsIndependent) {
    LONG index = 5;
    ASSERT_EQ(SafeArrayPutElement(psa, &index, BStr("original").Get()), S_OK);
    SAFEARRAY* copy = nullptr;
    ASSERT_EQ(SafeArrayCopy(psa, &copy), S_OK);
    ASSERT_NE(copy, nullptr);
    EXPECT_NE(copy->pvData, psa->pvData);
    EXPECT_NE(static_cast<BSTR*>(copy->pvData)[0], static_cast<BSTR*>(psa->pvData)[0]);
    EXPECT_EQ(copy->rgsabound[0].lLbound, 5);
    EXPECT_EQ(copy->rgsabound[0].cElements, 3u);
    VARTYPE vt = VT_EMPTY;
    EXPECT_EQ(SafeArrayGetVartype(copy, &vt), S_OK);
    EXPECT_EQ(vt, VT_BSTR);

    ASSERT_EQ(SafeArrayPutElement(copy, &index, BStr("changed").Get()), S_OK);
    EXPECT_EQ(Get(5), u"original");
    EXPECT_EQ(SafeArrayDestroy(copy), S_OK);
    EXPECT_EQ(Get(5), u"original");
}

TEST(ComSafeArrayTypes, InterfaceElementsAreCounted) {
    CountingUnknown unk;
    SAFEARRAY* psa = SafeArrayCreateVector(VT_UNKNOWN, 0, 2);
    ASSERT_NE(psa, nullptr);
    LONG index = 1;
    ASSERT_EQ(SafeArrayPutElement(psa, &index, static_cast<IUnknown*>(&unk)), S_OK);
    EXPECT_EQ(unk.refs, 2u);
    IUnknown* got = nullptr;
    ASSERT_EQ(SafeArrayGetElement(psa, &index, &got), S_OK);
    EXPECT_EQ(got, &unk);
    EXPECT_EQ(unk.refs, 3u);
    got->Release();

    SAFEARRAY* copy = nullptr;
    ASSERT_EQ(SafeArrayCopy(psa, &copy), S_OK);
    EXPECT_EQ(unk.refs, 3u);
    EXPECT_EQ(SafeArrayDestroy(copy), S_OK);
    EXPECT_EQ(unk.refs, 2u);
    ASSERT_EQ(SafeArrayPutElement(psa, &index, nullptr), S_OK);
    EXPECT_EQ(unk.refs, 1u);
    ASSERT_EQ(SafeArrayPutElement(psa, &index, static_cast<IUnknown*>(&unk)), S_OK);
    EXPECT_EQ(SafeArrayDestroy(psa), S_OK);
    EXPECT_EQ(unk.refs, 1u);
}

TEST(ComSafeArrayTypes, VariantAndScalarElements) {
    SAFEARRAY* variants = SafeArrayCreateVector(VT_VARIANT, -1, 2);
    ASSERT_NE(variants, nullptr);
    VARIANT v;
    VariantInit(&v);
    v.vt = VT_BSTR;
    v.bstrVal = SysAllocString(u"inside");
    LONG index = 0;
    ASSERT_EQ(SafeArrayPutElement(variants, &index, &v), S_OK);
    VARIANT got;
    ASSERT_EQ(SafeArrayGetElement(variants, &index, &got), S_OK);
    EXPECT_EQ(got.vt, VT_BSTR);
    EXPECT_NE(got.bstrVal, v.bstrVal);
    EXPECT_EQ(Str(got.bstrVal), u"inside");
    EXPECT_EQ(VariantClear(&got), S_OK);
    EXPECT_EQ(VariantClear(&v), S_OK);
    EXPECT_EQ(SafeArrayDestroy(variants), S_OK);  // frees the stored copy

    SAFEARRAYBOUND bound{4, -2};
    SAFEARRAY* ints = SafeArrayCreate(VT_I4, 1, &bound);
    ASSERT_NE(ints, nullptr);
    LONG value = -123456;
    index = 1;
    ASSERT_EQ(SafeArrayPutElement(ints, &index, &value), S_OK);
    EXPECT_EQ(SafeArrayPutElement(ints, &index, nullptr), E_INVALIDARG);
    LONG out = 0;
    ASSERT_EQ(SafeArrayGetElement(ints, &index, &out), S_OK);
    EXPECT_EQ(out, value);
    EXPECT_EQ(static_cast<LONG*>(ints->pvData)[3], value);
    EXPECT_EQ(SafeArrayDestroy(ints), S_OK);
}

TEST(ComSafeArrayTypes, UnsupportedShapesAndNulls) {
    EXPECT_EQ(SafeArrayCreateVector(VT_EMPTY, 0, 1), nullptr);
    EXPECT_EQ(SafeArrayCreateVector(VT_ERROR, 0, 1), nullptr);
    SAFEARRAYBOUND bounds[2] = {{2, 0}, {2, 0}};
    EXPECT_EQ(SafeArrayCreate(VT_I4, 2, bounds), nullptr);
    EXPECT_EQ(SafeArrayCreate(VT_I4, 0, bounds), nullptr);

    LONG l = 0;
    VARTYPE vt = VT_EMPTY;
    EXPECT_EQ(SafeArrayGetDim(nullptr), 0u);
    EXPECT_EQ(SafeArrayGetLBound(nullptr, 1, &l), E_INVALIDARG);
    EXPECT_EQ(SafeArrayGetVartype(nullptr, &vt), E_INVALIDARG);
    EXPECT_EQ(SafeArrayLock(nullptr), E_INVALIDARG);
    EXPECT_EQ(SafeArrayDestroy(nullptr), S_OK);
    SAFEARRAY* out = reinterpret_cast<SAFEARRAY*>(&l);
    EXPECT_EQ(SafeArrayCopy(nullptr, &out), S_OK);
    EXPECT_EQ(out, nullptr);
}

TEST(ComSafeArrayTypes, MakeBstrArrayConvertsUtf8) {
    SAFEARRAY* psa = MakeBstrArray({"stun.example.org", "\xC3\xBC", ""});
    ASSERT_NE(psa, nullptr);
    EXPECT_EQ(psa->rgsabound[0].lLbound, 0);
    EXPECT_EQ(psa->rgsabound[0].cElements, 3u);
    const BSTR* items = static_cast<BSTR*>(psa->pvData);
    EXPECT_EQ(Utf8FromBstr(items[0]), "stun.example.org");
    EXPECT_EQ(Str(items[1]), u"\u00FC");
    EXPECT_NE(items[2], nullptr);
    EXPECT_EQ(SafeArrayDestroy(psa), S_OK);
}

}  // namespace
