// ComPtr's reference accounting against an object that counts its own references.
#include <gtest/gtest.h>

#include <nqportmanager/ComPtr.h>

namespace {

struct ISecond : IUnknown {};
constexpr IID IID_ISecond = MakeGuid("3C1E0C7A-0000-4000-8000-000000000001");

class Counted final : public ISecond {
  public:
    HRESULT QueryInterface(REFIID riid, void** ppv) override {
        if (riid == IID_IUnknown || riid == IID_ISecond) {
            *ppv = static_cast<ISecond*>(this);
            AddRef();
            return S_OK;
        }
        *ppv = nullptr;
        return E_NOINTERFACE;
    }
    ULONG AddRef() override { return ++refs; }
    ULONG Release() override { return --refs; }
    ULONG refs = 1;  // the test's own
};

}  // namespace

NQ_DECLARE_COM_IID(ISecond, IID_ISecond);

TEST(ComPtr, HoldsExactlyOneReferenceThroughCopyMoveAttachDetachAndAs) {
    Counted object;
    {
        ComPtr<IUnknown> a(&object);
        EXPECT_EQ(object.refs, 2u);
        ComPtr<IUnknown> b = a;
        EXPECT_EQ(object.refs, 3u);
        ComPtr<IUnknown> c = std::move(b);
        EXPECT_FALSE(b);
        EXPECT_EQ(object.refs, 3u);
        c = a;  // same object: no net change
        EXPECT_EQ(object.refs, 3u);
        c = nullptr;
        EXPECT_EQ(object.refs, 2u);

        ComPtr<ISecond> second = a.As<ISecond>();
        EXPECT_EQ(second.Get(), &object);
        EXPECT_EQ(object.refs, 3u);
        ComPtr<IDispatch> missing;
        EXPECT_EQ(a.As(&missing), E_NOINTERFACE);
        EXPECT_FALSE(missing);

        IUnknown* out = nullptr;
        EXPECT_EQ(a.CopyTo(&out), S_OK);
        EXPECT_EQ(object.refs, 4u);
        ComPtr<IUnknown> adopted = ComPtr<IUnknown>::Attach(out);  // no count added
        EXPECT_EQ(object.refs, 4u);
        IUnknown* handedOff = adopted.Detach();
        EXPECT_EQ(object.refs, 4u);
        handedOff->Release();
        EXPECT_EQ(a.CopyTo(nullptr), E_POINTER);

        // An out parameter releases what was held before it is written.
        ComPtr<IUnknown> reused(&object);
        EXPECT_EQ(object.refs, 4u);
        EXPECT_EQ(object.QueryInterface(IID_IUnknown, reused.GetVoidAddressOf()), S_OK);
        EXPECT_EQ(object.refs, 4u);
    }
    EXPECT_EQ(object.refs, 1u);
}
