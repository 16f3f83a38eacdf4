// The TIN reader factory: the slot of the installed implementation and the built-in one.
#include <kestrel/tin.h>

#include <mutex>
#include <utility>

#include "tinreader.h"

namespace kestrel {
namespace tin {

TinReaderFactoryImpl::~TinReaderFactoryImpl() = default;

namespace {

class BuiltInFactory final : public TinReaderFactoryImpl {
  public:
    TinReader* CreateTinReader(const char* path, int layer, double offset, double scale,
                               ogc::cs::DatumType datum) override {
        if (path == nullptr)
            return nullptr;
        return OpenTinReader(path, layer, offset, scale, datum).release();
    }
};

struct ImplSlot {
    std::mutex mutex;
    std::shared_ptr<TinReaderFactoryImpl> builtIn = std::make_shared<BuiltInFactory>();
    std::shared_ptr<TinReaderFactoryImpl> current = builtIn;
};

ImplSlot& Slot() {
    static ImplSlot slot;
    return slot;
}

}  // namespace

TinReader* TinReaderFactory::CreateTinReader(const char* path, int layer, double offset,
                                             double scale, ogc::cs::DatumType datum) {
    std::shared_ptr<TinReaderFactoryImpl> impl;
    {
        std::lock_guard<std::mutex> lock(Slot().mutex);
        impl = Slot().current;
    }
    return impl->CreateTinReader(path, layer, offset, scale, datum);
}

std::shared_ptr<TinReaderFactoryImpl> TinReaderFactory::GetDefaultImplementation() {
    std::lock_guard<std::mutex> lock(Slot().mutex);
    return Slot().builtIn;
}

std::shared_ptr<TinReaderFactoryImpl> TinReaderFactory::SetImplementation(
    std::shared_ptr<TinReaderFactoryImpl> impl) {
    std::lock_guard<std::mutex> lock(Slot().mutex);
    if (!impl)
        impl = Slot().builtIn;
    std::swap(Slot().current, impl);
    return impl;
}

ScopedTinReaderFactoryImpl::ScopedTinReaderFactoryImpl(std::shared_ptr<TinReaderFactoryImpl> impl)
    : previous_(TinReaderFactory::SetImplementation(std::move(impl))) {}

ScopedTinReaderFactoryImpl::~ScopedTinReaderFactoryImpl() {
    TinReaderFactory::SetImplementation(std::move(previous_));
}

}  // namespace tin
}  // namespace kestrel
