// The building blocks of a type library described as data: types in OLE terms, members with their
// DISPIDs and parameters, enumerations, interfaces, coclasses. Each member also carries a call
// into the vtable generated from its C++ declaration, and MakeMember refuses (at compile time) a
// description whose parameters differ from that declaration.
#pragma once

#include <bit>
#include <cstddef>
#include <cstdint>
#include <span>
#include <tuple>
#include <type_traits>
#include <utility>

#include <nqportmanager/typeinfo.h>

namespace automation {

// VT_BSTR, VT_I4, VT_INT, VT_BOOL, VT_VARIANT, VT_UNKNOWN, VT_DISPATCH, or VT_USERDEFINED with the
// name of an enumeration or interface of the library; out parameters are passed by pointer.
struct TypeRef {
    VARTYPE vt;
    const char* userType = nullptr;
    bool out = false;
};

struct ParamDesc {
    const char* name;
    TypeRef type;
};

// Calls the member on instance (a pointer to its interface) with args[i] holding parameter i in
// the exact type; a retval is written into *result (its union member only).
using MemberCall = HRESULT (*)(void* instance, VARIANT* args, VARIANT* result);

struct MemberDesc {
    const char* name;
    DISPID dispid;
    INVOKEKIND kind;
    std::span<const ParamDesc> params;  // vtable order; an out parameter only last, as retval
    MemberCall call;
    SHORT (*vtableOffset)();  // byte offset of the member in its vtable
};

struct EnumValue {
    const char* name;
    LONG value;
};

struct ImplType {
    const char* interfaceName;
    INT flags;  // IMPLTYPEFLAG_
};

struct TypeDesc {
    TYPEKIND kind;
    const char* name;
    const GUID* guid;
    WORD flags;  // TYPEFLAG_
    const char* doc;
    std::span<const MemberDesc> members;  // TKIND_INTERFACE
    std::span<const EnumValue> values;    // TKIND_ENUM
    std::span<const ImplType> impls;      // TKIND_COCLASS
    WORD baseSlots = 0;                   // 7 under IDispatch, 3 under IUnknown
};

struct LibraryDesc {
    const char* name;
    const GUID* guid;
    WORD majorVersion;
    WORD minorVersion;
    LCID lcid;
    const char* doc;
    std::span<const TypeDesc> types;
};

constexpr bool SameText(const char* a, const char* b) {
    if (a == nullptr || b == nullptr) {
        return a == b;
    }
    for (; *a != '\0' && *a == *b; ++a, ++b) {
    }
    return *a == *b;
}

// ---- From C++ declarations ------------------------------------------------------------------

// The library's name of an enumeration or interface; declared beside the library's description.
template <typename T>
inline constexpr const char* kUserTypeName = nullptr;

template <typename T>
struct Arg;

template <>
struct Arg<BSTR> {
    static constexpr TypeRef type{VT_BSTR};
    static BSTR From(VARIANT& v) { return v.bstrVal; }
    static void To(VARIANT& v, BSTR x) { v.bstrVal = x; }
};
// LONG and INT are one C++ type here; the description says which of VT_I4 and VT_INT it is.
template <>
struct Arg<int32_t> {
    static constexpr TypeRef type{VT_I4};
    static int32_t From(VARIANT& v) { return v.lVal; }
    static void To(VARIANT& v, int32_t x) { v.lVal = x; }
};
// Windows' LONG is long, a type of its own beside int32_t.
template <typename L>
requires(std::is_same_v<L, long> && !std::is_same_v<long, int32_t>) struct Arg<L> {
    static constexpr TypeRef type{VT_I4};
    static L From(VARIANT& v) { return v.lVal; }
    static void To(VARIANT& v, L x) { v.lVal = x; }
};
template <>
struct Arg<VARIANT_BOOL> {
    static constexpr TypeRef type{VT_BOOL};
    static VARIANT_BOOL From(VARIANT& v) { return v.boolVal; }
    static void To(VARIANT& v, VARIANT_BOOL x) { v.boolVal = x; }
};
template <>
struct Arg<VARIANT> {
    static constexpr TypeRef type{VT_VARIANT};
    static VARIANT From(VARIANT& v) { return v; }
};
template <typename E>
requires std::is_enum_v<E>
struct Arg<E> {
    static_assert(kUserTypeName<E> != nullptr, "name the enumeration with kUserTypeName");
    static constexpr TypeRef type{VT_USERDEFINED, kUserTypeName<E>};
    static E From(VARIANT& v) { return static_cast<E>(v.lVal); }
    static void To(VARIANT& v, E x) { v.lVal = static_cast<LONG>(x); }
};
template <typename I>
constexpr TypeRef InterfaceType() {
    if constexpr (std::is_same_v<I, IUnknown>) {
        return {VT_UNKNOWN};
    } else if constexpr (std::is_same_v<I, IDispatch>) {
        return {VT_DISPATCH};
    } else {
        static_assert(kUserTypeName<I> != nullptr, "name the interface with kUserTypeName");
        return {VT_USERDEFINED, kUserTypeName<I>};
    }
}
// Interface pointers arrive in byref, already asked for the parameter's interface.
template <typename I>
requires std::is_base_of_v<IUnknown, I>
struct Arg<I*> {
    static constexpr TypeRef type = InterfaceType<I>();
    static I* From(VARIANT& v) { return static_cast<I*>(v.byref); }
    static void To(VARIANT& v, I* x) { v.punkVal = x; }
};
template <typename T>
requires(!std::is_base_of_v<IUnknown, T>) struct Arg<T*> {
    static constexpr TypeRef type{Arg<T>::type.vt, Arg<T>::type.userType, true};
};

template <typename T>
inline constexpr bool kIsOut = Arg<T>::type.out;

// One argument of a call: an in value read from its VARIANT, or an out value held here.
template <typename T>
struct Slot {
    Slot(VARIANT& v) : arg(v) {}
    T Get() { return Arg<T>::From(arg); }
    void Store(VARIANT*) {}
    VARIANT& arg;
};
template <typename T>
requires kIsOut<T>
struct Slot<T> {
    using Value = std::remove_pointer_t<T>;
    Slot(VARIANT&) {}
    T Get() { return &value; }
    void Store(VARIANT* result) { Arg<Value>::To(*result, value); }
    Value value{};
};

template <typename F>
struct MemberTraits;
template <typename I, typename... A>
struct MemberTraits<HRESULT (I::*)(A...)> {
    using Interface = I;
    static constexpr size_t kCount = sizeof...(A);
    static constexpr TypeRef kTypes[kCount + 1] = {Arg<A>::type..., TypeRef{VT_EMPTY}};

    template <auto M, size_t... N>
    static HRESULT Call(void* instance, VARIANT* args, VARIANT* result, std::index_sequence<N...>) {
        (void)args;
        (void)result;
        [[maybe_unused]] std::tuple<Slot<A>...> slots(args[N]...);
        const HRESULT hr = (static_cast<I*>(instance)->*M)(std::get<N>(slots).Get()...);
        if (SUCCEEDED(hr)) {
            (std::get<N>(slots).Store(result), ...);
        }
        return hr;
    }
};

template <auto M>
HRESULT CallMember(void* instance, VARIANT* args, VARIANT* result) {
    using Traits = MemberTraits<decltype(M)>;
    return Traits::template Call<M>(instance, args, result,
                                    std::make_index_sequence<Traits::kCount>{});
}

// The slot of a virtual member, from the Itanium C++ ABI's member pointer (the ARM variant marks
// virtual members in the adjustment instead); -1 for a member that is not virtual.
template <auto M>
SHORT VtableOffset() {
    struct Representation {
        uintptr_t ptr;
        ptrdiff_t adj;
    };
    static_assert(sizeof(decltype(M)) == sizeof(Representation));
    const auto rep = std::bit_cast<Representation>(M);
#if defined(__arm__) || defined(__aarch64__)
    return (rep.adj & 1) != 0 ? static_cast<SHORT>(rep.ptr) : SHORT{-1};
#else
    return (rep.ptr & 1) != 0 ? static_cast<SHORT>(rep.ptr - 1) : SHORT{-1};
#endif
}

constexpr bool SameType(const TypeRef& declared, const TypeRef& described) {
    const bool sameVt = declared.vt == described.vt ||
                        (declared.vt == VT_I4 && described.vt == VT_INT);  // LONG is INT
    return sameVt && declared.out == described.out &&
           SameText(declared.userType, described.userType);
}

// A member of the description; refused by the compiler when its parameters are not those of
// the C++ declaration M in number, order and type, or its kind does not fit them.
template <auto M>
consteval MemberDesc MakeMember(const char* name, DISPID dispid, INVOKEKIND kind,
                                std::span<const ParamDesc> params = {}) {
    using Traits = MemberTraits<decltype(M)>;
    if (params.size() != Traits::kCount) {
        throw "the description's parameter count differs from the declaration";
    }
    for (size_t i = 0; i < params.size(); ++i) {
        if (!SameType(Traits::kTypes[i], params[i].type)) {
            throw "a parameter type of the description differs from the declaration";
        }
        if (params[i].type.out && i + 1 != params.size()) {
            throw "only the last parameter may be out (the retval)";
        }
    }
    const bool retval = !params.empty() && params.back().type.out;
    if ((kind == INVOKE_PROPERTYGET && (params.size() != 1 || !retval)) ||
        (kind == INVOKE_PROPERTYPUT && (params.size() != 1 || retval))) {
        throw "a property takes exactly its value";
    }
    return MemberDesc{name, dispid, kind, params, &CallMember<M>, &VtableOffset<M>};
}

}  // namespace automation
