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

// The most triangles that one height lookup of a reader OpenTinReader made tests (0 for
// another reader): what the index costs at worst, for the tests.
KESTREL_API std::size_t LargestIndexCell(const TinReader& reader);

}  // namespace tin
}  // namespace kestrel
