// TIN surfaces read with OGR.
#pragma once

#include <memory>
#include <string>

#include <kestrel/tin.h>

namespace kestrel {
namespace tin {

// See TinReaderFactoryImpl::CreateTinReader.
std::unique_ptr<TinReader> OpenTinReader(const std::string& path, int layer, double offset,
                                         double scale, ogc::cs::DatumType datum);

}  // namespace tin
}  // namespace kestrel
