// ITypeLib and ITypeInfo over a LibraryDesc: one library object and one type info per type, all
// living as long as the module; their references only lock the module.
#include <atomic>
#include <cstdint>
#include <memory>
#include <new>
#include <string>
#include <vector>

#include "automation/Invoke.h"
#include "automation/NqPortManagerLib.h"
#include "platform/modulelock.h"

namespace automation {

namespace {

// Enumeration constants get ids of their own, apart from the DISPIDs of members.
constexpr MEMBERID kConstantBase = 0x40000000;
constexpr size_t kMaxParams = 16;

// The index of an enumeration constant's id; SIZE_MAX for any other id.
size_t ConstantIndex(MEMBERID memid) {
    return memid >= kConstantBase ? static_cast<size_t>(memid - kConstantBase) : SIZE_MAX;
}

bool SameName(const char* name, std::u16string_view text) {
    size_t i = 0;
    for (; name[i] != '\0'; ++i) {
        if (i >= text.size()) {
            return false;
        }
        const auto lower = [](char16_t c) { return c >= u'A' && c <= u'Z' ? c + 32 : c; };
        if (lower(static_cast<char16_t>(static_cast<unsigned char>(name[i]))) != lower(text[i])) {
            return false;
        }
    }
    return i == text.size();
}

std::u16string_view NameView(LPOLESTR name) {
    // Names are plain strings: their length is where the first NUL is, as oleaut32 reads them.
    return name == nullptr ? std::u16string_view() : std::u16string_view(name);
}

HRESULT PutText(const char* text, BSTR* out) {
    if (out == nullptr) {
        return S_OK;
    }
    *out = text == nullptr ? nullptr : BstrFromUtf8(text);
    return text != nullptr && *out == nullptr ? E_OUTOFMEMORY : S_OK;
}

class TypeLib;

class TypeInfo final : public ITypeInfo {
  public:
    TypeInfo(TypeLib& library, const TypeDesc& type, UINT index)
        : m_library(library), m_type(type), m_index(index) {}

    HRESULT QueryInterface(REFIID riid, void** ppv) override;
    ULONG AddRef() override;
    ULONG Release() override;

    HRESULT GetTypeAttr(TYPEATTR** ppTypeAttr) override;
    HRESULT GetTypeComp(ITypeComp** ppTComp) override {
        return NotImplemented(reinterpret_cast<void**>(ppTComp));
    }
    HRESULT GetFuncDesc(UINT index, FUNCDESC** ppFuncDesc) override;
    HRESULT GetVarDesc(UINT index, VARDESC** ppVarDesc) override;
    HRESULT GetNames(MEMBERID memid, BSTR* rgBstrNames, UINT cMaxNames, UINT* pcNames) override;
    HRESULT GetRefTypeOfImplType(UINT index, HREFTYPE* pRefType) override;
    HRESULT GetImplTypeFlags(UINT index, INT* pImplTypeFlags) override;
    HRESULT GetIDsOfNames(LPOLESTR* rgszNames, UINT cNames, MEMBERID* pMemId) override;
    HRESULT Invoke(PVOID pvInstance, MEMBERID memid, WORD wFlags, DISPPARAMS* pDispParams,
                   VARIANT* pVarResult, EXCEPINFO* pExcepInfo, UINT* puArgErr) override;
    HRESULT GetDocumentation(MEMBERID memid, BSTR* pBstrName, BSTR* pBstrDocString,
                             DWORD* pdwHelpContext, BSTR* pBstrHelpFile) override;
    HRESULT GetDllEntry(MEMBERID, INVOKEKIND, BSTR* pBstrDllName, BSTR* pBstrName, WORD*) override {
        NotImplemented(reinterpret_cast<void**>(pBstrDllName));
        return NotImplemented(reinterpret_cast<void**>(pBstrName));
    }
    HRESULT GetRefTypeInfo(HREFTYPE hRefType, ITypeInfo** ppTInfo) override;
    HRESULT AddressOfMember(MEMBERID, INVOKEKIND, PVOID* ppv) override {
        return NotImplemented(ppv);
    }
    HRESULT CreateInstance(IUnknown*, REFIID, PVOID* ppvObj) override {
        return NotImplemented(ppvObj);
    }
    HRESULT GetMops(MEMBERID, BSTR* pBstrMops) override {
        return NotImplemented(reinterpret_cast<void**>(pBstrMops));
    }
    HRESULT GetContainingTypeLib(ITypeLib** ppTLib, UINT* pIndex) override;
    void ReleaseTypeAttr(TYPEATTR* pTypeAttr) override { delete pTypeAttr; }
    void ReleaseFuncDesc(FUNCDESC* pFuncDesc) override;
    void ReleaseVarDesc(VARDESC* pVarDesc) override;

  private:
    static HRESULT NotImplemented(void** out) {
        if (out != nullptr) {
            *out = nullptr;
        }
        return E_NOTIMPL;
    }
    TYPEDESC Describe(const TypeRef& type, TYPEDESC (&chain)[2]) const;

    TypeLib& m_library;
    const TypeDesc& m_type;
    UINT m_index;
};

// A FUNCDESC with the storage its pointers point into; desc comes first so that the pointer
// handed out leads back to the block.
struct FuncDescBlock {
    FUNCDESC desc;
    ELEMDESC params[kMaxParams];
    TYPEDESC types[kMaxParams][2];
};
static_assert(std::is_standard_layout_v<FuncDescBlock>);

struct VarDescBlock {
    VARDESC desc;
    VARIANT value;
};
static_assert(std::is_standard_layout_v<VarDescBlock>);

class TypeLib final : public ITypeLib {
  public:
    explicit TypeLib(const LibraryDesc& desc) : m_desc(desc) {
        for (size_t i = 0; i < desc.types.size(); ++i) {
            m_infos.push_back(
                std::make_unique<TypeInfo>(*this, desc.types[i], static_cast<UINT>(i)));
        }
    }

    const LibraryDesc& Desc() const { return m_desc; }
    // Index of a named type of the library, as its HREFTYPE.
    HREFTYPE RefOf(const char* name) const {
        size_t index = 0;
        return FindType(m_desc, name, &index) != nullptr ? static_cast<HREFTYPE>(index)
                                                         : HREFTYPE(~0u);
    }

    HRESULT QueryInterface(REFIID riid, void** ppv) override {
        if (ppv == nullptr) {
            return E_POINTER;
        }
        if (riid != IID_IUnknown && riid != IID_ITypeLib) {
            *ppv = nullptr;
            return E_NOINTERFACE;
        }
        *ppv = static_cast<ITypeLib*>(this);
        AddRef();
        return S_OK;
    }
    ULONG AddRef() override {
        const ULONG refs = ++m_refs;
        if (refs == 1) {
            platform::LockModule();
        }
        return refs;
    }
    ULONG Release() override {
        const ULONG refs = --m_refs;
        if (refs == 0) {
            platform::UnlockModule();
        }
        return refs;
    }

    UINT GetTypeInfoCount() override { return static_cast<UINT>(m_infos.size()); }
    HRESULT GetTypeInfo(UINT index, ITypeInfo** ppTInfo) override {
        if (ppTInfo == nullptr) {
            return E_INVALIDARG;
        }
        *ppTInfo = nullptr;
        if (index >= m_infos.size()) {
            return TYPE_E_ELEMENTNOTFOUND;
        }
        *ppTInfo = m_infos[index].get();
        AddRef();
        return S_OK;
    }
    HRESULT GetTypeInfoType(UINT index, TYPEKIND* pTKind) override {
        if (pTKind == nullptr) {
            return E_INVALIDARG;
        }
        if (index >= m_infos.size()) {
            return TYPE_E_ELEMENTNOTFOUND;
        }
        *pTKind = m_desc.types[index].kind;
        return S_OK;
    }
    HRESULT GetTypeInfoOfGuid(REFGUID guid, ITypeInfo** ppTinfo) override {
        if (ppTinfo == nullptr) {
            return E_INVALIDARG;
        }
        *ppTinfo = nullptr;
        for (size_t i = 0; i < m_desc.types.size(); ++i) {
            if (m_desc.types[i].kind != TKIND_ENUM && *m_desc.types[i].guid == guid) {
                return GetTypeInfo(static_cast<UINT>(i), ppTinfo);
            }
        }
        return TYPE_E_ELEMENTNOTFOUND;
    }
    HRESULT GetLibAttr(TLIBATTR** ppTLibAttr) override {
        if (ppTLibAttr == nullptr) {
            return E_INVALIDARG;
        }
        *ppTLibAttr = new (std::nothrow) TLIBATTR{
            *m_desc.guid,        m_desc.lcid,         sizeof(void*) == 8 ? SYS_WIN64 : SYS_WIN32,
            m_desc.majorVersion, m_desc.minorVersion, 0};
        return *ppTLibAttr == nullptr ? E_OUTOFMEMORY : S_OK;
    }
    HRESULT GetTypeComp(ITypeComp** ppTComp) override {
        if (ppTComp != nullptr) {
            *ppTComp = nullptr;
        }
        return E_NOTIMPL;
    }
    HRESULT GetDocumentation(INT index, BSTR* pBstrName, BSTR* pBstrDocString,
                             DWORD* pdwHelpContext, BSTR* pBstrHelpFile) override {
        if (index < -1 || index >= static_cast<INT>(m_infos.size())) {
            return TYPE_E_ELEMENTNOTFOUND;
        }
        if (index >= 0) {
            return m_infos[static_cast<size_t>(index)]->GetDocumentation(
                MEMBERID_NIL, pBstrName, pBstrDocString, pdwHelpContext, pBstrHelpFile);
        }
        if (pdwHelpContext != nullptr) {
            *pdwHelpContext = 0;
        }
        PutText(nullptr, pBstrHelpFile);
        if (FAILED(PutText(m_desc.name, pBstrName)) ||
            FAILED(PutText(m_desc.doc, pBstrDocString))) {
            return E_OUTOFMEMORY;
        }
        return S_OK;
    }
    HRESULT IsName(LPOLESTR szNameBuf, ULONG, BOOL* pfName) override {
        if (szNameBuf == nullptr || pfName == nullptr) {
            return E_INVALIDARG;
        }
        const std::u16string_view name = NameView(szNameBuf);
        *pfName = 0;
        for (const TypeDesc& t : m_desc.types) {
            bool found = SameName(t.name, name);
            for (const MemberDesc& m : t.members) {
                found = found || SameName(m.name, name);
            }
            for (const EnumValue& v : t.values) {
                found = found || SameName(v.name, name);
            }
            *pfName = *pfName || found;
        }
        return S_OK;
    }
    HRESULT FindName(LPOLESTR, ULONG, ITypeInfo**, MEMBERID*, USHORT* pcFound) override {
        if (pcFound != nullptr) {
            *pcFound = 0;
        }
        return E_NOTIMPL;
    }
    void ReleaseTLibAttr(TLIBATTR* pTLibAttr) override { delete pTLibAttr; }

  private:
    const LibraryDesc& m_desc;
    std::vector<std::unique_ptr<TypeInfo>> m_infos;
    std::atomic<ULONG> m_refs{0};
};

HRESULT TypeInfo::QueryInterface(REFIID riid, void** ppv) {
    if (ppv == nullptr) {
        return E_POINTER;
    }
    if (riid != IID_IUnknown && riid != IID_ITypeInfo) {
        *ppv = nullptr;
        return E_NOINTERFACE;
    }
    *ppv = static_cast<ITypeInfo*>(this);
    AddRef();
    return S_OK;
}

ULONG TypeInfo::AddRef() {
    return m_library.AddRef();
}

ULONG TypeInfo::Release() {
    return m_library.Release();
}

HRESULT TypeInfo::GetTypeAttr(TYPEATTR** ppTypeAttr) {
    if (ppTypeAttr == nullptr) {
        return E_INVALIDARG;
    }
    auto* attr = new (std::nothrow) TYPEATTR{};
    *ppTypeAttr = attr;
    if (attr == nullptr) {
        return E_OUTOFMEMORY;
    }
    attr->guid = *m_type.guid;
    attr->lcid = m_library.Desc().lcid;
    attr->memidConstructor = MEMBERID_NIL;
    attr->memidDestructor = MEMBERID_NIL;
    attr->typekind = m_type.kind;
    attr->cFuncs = static_cast<WORD>(m_type.members.size());
    attr->cVars = static_cast<WORD>(m_type.values.size());
    attr->cImplTypes = static_cast<WORD>(m_type.impls.size());
    attr->wTypeFlags = m_type.flags;
    if (m_type.kind == TKIND_ENUM) {
        attr->cbSizeInstance = sizeof(LONG);
        attr->cbAlignment = alignof(LONG);
    } else {
        attr->cbSizeInstance = sizeof(void*);
        attr->cbAlignment = alignof(void*);
    }
    if (m_type.kind == TKIND_INTERFACE) {
        attr->cbSizeVft =
            static_cast<WORD>((m_type.baseSlots + m_type.members.size()) * sizeof(void*));
    }
    return S_OK;
}

// The TYPEDESC of a described type; the levels a pointer adds point into chain.
TYPEDESC TypeInfo::Describe(const TypeRef& type, TYPEDESC (&chain)[2]) const {
    TYPEDESC base{};
    base.vt = type.vt;
    if (type.vt == VT_USERDEFINED) {
        base.hreftype = m_library.RefOf(type.userType);
    }
    const TypeDesc* named =
        type.vt == VT_USERDEFINED ? FindType(m_library.Desc(), type.userType) : nullptr;
    const int levels =
        (named != nullptr && named->kind == TKIND_INTERFACE ? 1 : 0) + (type.out ? 1 : 0);
    TYPEDESC outer = base;
    for (int level = 0; level < levels; ++level) {
        chain[levels - 1 - level] = outer;
        outer = TYPEDESC{};
        outer.vt = VT_PTR;
        outer.lptdesc = &chain[levels - 1 - level];
    }
    return outer;
}

HRESULT TypeInfo::GetFuncDesc(UINT index, FUNCDESC** ppFuncDesc) {
    if (ppFuncDesc == nullptr) {
        return E_INVALIDARG;
    }
    *ppFuncDesc = nullptr;
    if (index >= m_type.members.size()) {
        return TYPE_E_ELEMENTNOTFOUND;
    }
    const MemberDesc& m = m_type.members[index];
    if (m.params.size() > kMaxParams) {
        return E_UNEXPECTED;
    }
    auto* block = new (std::nothrow) FuncDescBlock{};
    if (block == nullptr) {
        return E_OUTOFMEMORY;
    }
    FUNCDESC& d = block->desc;
    d.memid = m.dispid;
    d.funckind = FUNC_PUREVIRTUAL;
    d.invkind = m.kind;
    d.callconv = CC_STDCALL;
    d.cParams = static_cast<SHORT>(m.params.size());
    d.oVft = m.vtableOffset();
    d.elemdescFunc.tdesc.vt = VT_HRESULT;
    d.lprgelemdescParam = block->params;
    for (size_t i = 0; i < m.params.size(); ++i) {
        const TypeRef& type = m.params[i].type;
        ELEMDESC& e = block->params[i];
        e.tdesc = Describe(type, block->types[i]);
        e.paramdesc.wParamFlags = type.out ? (PARAMFLAG_FOUT | PARAMFLAG_FRETVAL) : PARAMFLAG_FIN;
    }
    *ppFuncDesc = &block->desc;
    return S_OK;
}

HRESULT TypeInfo::GetVarDesc(UINT index, VARDESC** ppVarDesc) {
    if (ppVarDesc == nullptr) {
        return E_INVALIDARG;
    }
    *ppVarDesc = nullptr;
    if (index >= m_type.values.size()) {
        return TYPE_E_ELEMENTNOTFOUND;
    }
    auto* block = new (std::nothrow) VarDescBlock{};
    if (block == nullptr) {
        return E_OUTOFMEMORY;
    }
    block->desc.memid = kConstantBase + static_cast<MEMBERID>(index);
    block->desc.varkind = VAR_CONST;
    block->desc.elemdescVar.tdesc.vt = VT_I4;
    block->value.vt = VT_I4;
    block->value.lVal = m_type.values[index].value;
    block->desc.lpvarValue = &block->value;
    *ppVarDesc = &block->desc;
    return S_OK;
}

void TypeInfo::ReleaseFuncDesc(FUNCDESC* pFuncDesc) {
    delete reinterpret_cast<FuncDescBlock*>(pFuncDesc);
}

void TypeInfo::ReleaseVarDesc(VARDESC* pVarDesc) {
    delete reinterpret_cast<VarDescBlock*>(pVarDesc);
}

HRESULT TypeInfo::GetNames(MEMBERID memid, BSTR* rgBstrNames, UINT cMaxNames, UINT* pcNames) {
    if (rgBstrNames == nullptr || pcNames == nullptr) {
        return E_INVALIDARG;
    }
    *pcNames = 0;
    std::vector<const char*> names;
    const size_t constant = ConstantIndex(memid);
    if (constant < m_type.values.size()) {
        names.push_back(m_type.values[constant].name);
    }
    for (const MemberDesc& m : m_type.members) {
        if (m.dispid == memid && names.empty()) {
            names.push_back(m.name);
            for (const ParamDesc& p : m.params) {
                names.push_back(p.name);
            }
        }
    }
    if (names.empty()) {
        return TYPE_E_ELEMENTNOTFOUND;
    }
    for (UINT i = 0; i < cMaxNames && i < names.size(); ++i) {
        if (FAILED(PutText(names[i], &rgBstrNames[i]))) {
            for (UINT j = 0; j < i; ++j) {
                SysFreeString(rgBstrNames[j]);
            }
            return E_OUTOFMEMORY;
        }
        *pcNames = i + 1;
    }
    return S_OK;
}

HRESULT TypeInfo::GetRefTypeOfImplType(UINT index, HREFTYPE* pRefType) {
    if (pRefType == nullptr) {
        return E_INVALIDARG;
    }
    if (index >= m_type.impls.size()) {
        return TYPE_E_ELEMENTNOTFOUND;
    }
    *pRefType = m_library.RefOf(m_type.impls[index].interfaceName);
    return S_OK;
}

HRESULT TypeInfo::GetImplTypeFlags(UINT index, INT* pImplTypeFlags) {
    if (pImplTypeFlags == nullptr) {
        return E_INVALIDARG;
    }
    if (index >= m_type.impls.size()) {
        return TYPE_E_ELEMENTNOTFOUND;
    }
    *pImplTypeFlags = m_type.impls[index].flags;
    return S_OK;
}

HRESULT TypeInfo::GetIDsOfNames(LPOLESTR* rgszNames, UINT cNames, MEMBERID* pMemId) {
    if (rgszNames == nullptr || pMemId == nullptr || cNames == 0) {
        return E_INVALIDARG;
    }
    for (UINT i = 0; i < cNames; ++i) {
        pMemId[i] = MEMBERID_NIL;
    }
    const std::u16string_view name = NameView(rgszNames[0]);
    // A property's get and put share the id; the names after the first are parameters of
    // whichever of them has them.
    bool found = false;
    for (size_t i = 0; i < m_type.values.size() && !found; ++i) {
        if (SameName(m_type.values[i].name, name)) {
            pMemId[0] = kConstantBase + static_cast<MEMBERID>(i);
            found = true;
        }
    }
    for (const MemberDesc& m : m_type.members) {
        if (!SameName(m.name, name)) {
            continue;
        }
        pMemId[0] = m.dispid;
        found = true;
        for (UINT n = 1; n < cNames; ++n) {
            for (size_t p = 0; p < m.params.size(); ++p) {
                if (!m.params[p].type.out && SameName(m.params[p].name, NameView(rgszNames[n]))) {
                    pMemId[n] = static_cast<MEMBERID>(p);
                }
            }
        }
    }
    for (UINT i = 0; i < cNames; ++i) {
        if (pMemId[i] == MEMBERID_NIL) {
            return DISP_E_UNKNOWNNAME;
        }
    }
    return found ? S_OK : DISP_E_UNKNOWNNAME;
}

HRESULT TypeInfo::Invoke(PVOID pvInstance, MEMBERID memid, WORD wFlags, DISPPARAMS* pDispParams,
                         VARIANT* pVarResult, EXCEPINFO* pExcepInfo, UINT* puArgErr) {
    if (m_type.kind != TKIND_INTERFACE) {
        return E_INVALIDARG;
    }
    return InvokeMember(m_library.Desc(), m_type, pvInstance, memid, wFlags, pDispParams,
                        pVarResult, pExcepInfo, puArgErr);
}

HRESULT TypeInfo::GetDocumentation(MEMBERID memid, BSTR* pBstrName, BSTR* pBstrDocString,
                                   DWORD* pdwHelpContext, BSTR* pBstrHelpFile) {
    const char* name = nullptr;
    const char* doc = nullptr;
    if (memid == MEMBERID_NIL) {
        name = m_type.name;
        doc = m_type.doc;
    }
    const size_t constant = ConstantIndex(memid);
    if (constant < m_type.values.size()) {
        name = m_type.values[constant].name;
    }
    for (const MemberDesc& m : m_type.members) {
        if (m.dispid == memid && name == nullptr) {
            name = m.name;
        }
    }
    if (name == nullptr) {
        return TYPE_E_ELEMENTNOTFOUND;
    }
    if (pdwHelpContext != nullptr) {
        *pdwHelpContext = 0;
    }
    PutText(nullptr, pBstrHelpFile);
    PutText(nullptr, pBstrDocString);
    if (FAILED(PutText(name, pBstrName)) || FAILED(PutText(doc, pBstrDocString))) {
        if (pBstrName != nullptr) {
            SysFreeString(*pBstrName);
            *pBstrName = nullptr;
        }
        return E_OUTOFMEMORY;
    }
    return S_OK;
}

HRESULT TypeInfo::GetRefTypeInfo(HREFTYPE hRefType, ITypeInfo** ppTInfo) {
    if (ppTInfo == nullptr) {
        return E_INVALIDARG;
    }
    return m_library.GetTypeInfo(hRefType, ppTInfo);
}

HRESULT TypeInfo::GetContainingTypeLib(ITypeLib** ppTLib, UINT* pIndex) {
    if (ppTLib == nullptr) {
        return E_INVALIDARG;
    }
    *ppTLib = &m_library;
    m_library.AddRef();
    if (pIndex != nullptr) {
        *pIndex = m_index;
    }
    return S_OK;
}

}  // namespace

ITypeLib* NqPortManagerTypeLib() {
    static TypeLib library(NqPortManagerLibrary());
    return &library;
}

}  // namespace automation

extern "C" {

HRESULT LoadRegTypeLib(REFGUID rguid, WORD wVerMajor, WORD wVerMinor, LCID lcid,
                       ITypeLib** pptlib) {
    if (pptlib == nullptr) {
        return E_INVALIDARG;
    }
    *pptlib = nullptr;
    const automation::LibraryDesc& desc = automation::NqPortManagerLibrary();
    // Locale neutral: it serves every locale whose reserved bits are clear.
    if (rguid != *desc.guid || wVerMajor != desc.majorVersion || wVerMinor > desc.minorVersion ||
        (lcid & 0xFFF00000u) != 0) {
        return TYPE_E_LIBNOTREGISTERED;
    }
    ITypeLib* library = automation::NqPortManagerTypeLib();
    library->AddRef();
    *pptlib = library;
    return S_OK;
}

}  // extern "C"
