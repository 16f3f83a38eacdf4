// The TIN reader factory: the slot of the installed implementation and the built-in one.
#include <kestrel/tin.h>

#include <utility>

#include "../factoryslot.h"
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

FactorySlot<TinReaderFactoryImpl>& Slot() {
    static FactorySlot<TinReaderFactoryImpl> slot(std::make_shared<BuiltInFactory>());
    return slot;
}

}  // namespace

TinReader* TinReaderFactory::CreateTinReader(const char* path, int layer, double offset,
                                             double scale, ogc::cs::DatumType datum) {
    return Slot().Current()->CreateTinReader(path, layer, offset, scale, datum);
}

std::shared_ptr<TinReaderFactoryImpl> TinReaderFactory::GetDefaultImplementation() {
    return Slot().BuiltIn();
}

std::shared_ptr<TinReaderFactoryImpl> TinReaderFactory::SetImplementation(
    std::shared_ptr<TinReaderFactoryImpl> impl) {
    return Slot().Install(std::move(impl));
}

ScopedTinReaderFactoryImpl::ScopedTinReaderFactoryImpl(std::shared_ptr<TinReaderFactoryImpl> impl)
    : previous_(TinReaderFactory::SetImplementation(std::move(impl))) {}

ScopedTinReaderFactoryImpl::~ScopedTinReaderFactoryImpl() {
    TinReaderFactory::SetImplementation(std::move(previous_));
}

}  // namespace tin
}  // namespace kestrel
