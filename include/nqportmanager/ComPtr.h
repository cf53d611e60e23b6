// A COM interface pointer that holds one reference for its scope, in the manner of WRL's
// ComPtr: copying adds a reference, destruction and Reset release it, Attach and Detach move a
// reference in and out without counting, and As<U>() asks QueryInterface for another interface.
#pragma once

#include <cstddef>
#include <utility>

#include <nqportmanager/com.h>

// The interface id of a type, for As<U>(). An interface declares it once, next to its IID:
// NQ_DECLARE_COM_IID(IFoo, IID_IFoo);
template <typename T>
inline constexpr const IID* ComIidOf = nullptr;
// Whether ComIidOf<T> is declared: comparing the address with null is no constant expression
// under UBSan's null checks, so the declaration says so itself.
template <typename T>
inline constexpr bool ComIidDeclared = false;

#define NQ_DECLARE_COM_IID(Interface, iid)                    \
    template <>                                               \
    inline constexpr const IID* ComIidOf<Interface> = &(iid); \
    template <>                                               \
    inline constexpr bool ComIidDeclared<Interface> = true

NQ_DECLARE_COM_IID(IUnknown, IID_IUnknown);
NQ_DECLARE_COM_IID(IDispatch, IID_IDispatch);
NQ_DECLARE_COM_IID(IClassFactory, IID_IClassFactory);
NQ_DECLARE_COM_IID(IConnectionPointContainer, IID_IConnectionPointContainer);
NQ_DECLARE_COM_IID(IConnectionPoint, IID_IConnectionPoint);
NQ_DECLARE_COM_IID(IEnumConnections, IID_IEnumConnections);
NQ_DECLARE_COM_IID(IEnumConnectionPoints, IID_IEnumConnectionPoints);
NQ_DECLARE_COM_IID(ISupportErrorInfo, IID_ISupportErrorInfo);

template <typename T>
class ComPtr {
  public:
    ComPtr() noexcept = default;
    ComPtr(std::nullptr_t) noexcept {}
    // Adds a reference of its own; the caller keeps the one it had.
    explicit ComPtr(T* p) noexcept : p_(p) { AddRefIfAny(); }
    ComPtr(const ComPtr& other) noexcept : p_(other.p_) { AddRefIfAny(); }
    ComPtr(ComPtr&& other) noexcept : p_(std::exchange(other.p_, nullptr)) {}
    ~ComPtr() { Reset(); }

    ComPtr& operator=(const ComPtr& other) noexcept {
        ComPtr(other).Swap(*this);
        return *this;
    }
    ComPtr& operator=(ComPtr&& other) noexcept {
        ComPtr(std::move(other)).Swap(*this);
        return *this;
    }
    ComPtr& operator=(std::nullptr_t) noexcept {
        Reset();
        return *this;
    }

    // Takes over a reference the caller owns, without adding one.
    static ComPtr Attach(T* p) noexcept {
        ComPtr owner;
        owner.p_ = p;
        return owner;
    }
    // Hands the held reference to the caller, who must release it.
    [[nodiscard]] T* Detach() noexcept { return std::exchange(p_, nullptr); }
    void Reset() noexcept {
        if (T* old = std::exchange(p_, nullptr)) {
            old->Release();
        }
    }
    void Swap(ComPtr& other) noexcept { std::swap(p_, other.p_); }

    T* Get() const noexcept { return p_; }
    T* operator->() const noexcept { return p_; }
    explicit operator bool() const noexcept { return p_ != nullptr; }
    // For out parameters that return a new reference: what was held is released first.
    T** GetAddressOf() noexcept {
        Reset();
        return &p_;
    }
    void** GetVoidAddressOf() noexcept { return reinterpret_cast<void**>(GetAddressOf()); }

    // Copies the reference out to a caller's out parameter (adds one).
    HRESULT CopyTo(T** out) const noexcept {
        if (out == nullptr) {
            return E_POINTER;
        }
        *out = p_;
        AddRefIfAny();
        return S_OK;
    }

    // QueryInterface for U; an empty result with the failure code when it is not offered.
    template <typename U>
    HRESULT As(ComPtr<U>* out) const noexcept {
        static_assert(ComIidDeclared<U>, "declare the IID with NQ_DECLARE_COM_IID");
        return As(*ComIidOf<U>, out);
    }
    template <typename U>
    ComPtr<U> As() const noexcept {
        ComPtr<U> out;
        As(&out);
        return out;
    }
    // For interfaces that answer under more than one id.
    template <typename U>
    HRESULT As(REFIID iid, ComPtr<U>* out) const noexcept {
        if (out == nullptr) {
            return E_POINTER;
        }
        if (p_ == nullptr) {
            *out = nullptr;
            return E_POINTER;
        }
        return p_->QueryInterface(iid, out->GetVoidAddressOf());
    }

    friend bool operator==(const ComPtr& a, const ComPtr& b) noexcept { return a.p_ == b.p_; }
    friend bool operator==(const ComPtr& a, std::nullptr_t) noexcept { return a.p_ == nullptr; }

  private:
    void AddRefIfAny() const noexcept {
        if (p_ != nullptr) {
            p_->AddRef();
        }
    }

    T* p_ = nullptr;
};
