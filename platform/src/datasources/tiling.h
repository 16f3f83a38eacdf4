// How an image is cut into tiles, shared by the readers and writers.
#pragma once

#include <algorithm>

#include <kestrel/exception.h>

namespace kestrel {
namespace datasources {

struct Window {
    unsigned int x = 0;
    unsigned int y = 0;
    unsigned int width = 0;
    unsigned int height = 0;
};

// Tiles of tileWidth x tileHeight from the top-left corner, row by row; the last column and row
// are cut to the image.
struct Tiling {
    unsigned int width = 0;
    unsigned int height = 0;
    unsigned int tileWidth = 256;
    unsigned int tileHeight = 256;

    unsigned int Columns() const { return width == 0 ? 0 : (width - 1) / tileWidth + 1; }
    unsigned int Rows() const { return height == 0 ? 0 : (height - 1) / tileHeight + 1; }
    unsigned int Count() const { return Columns() * Rows(); }

    Window Tile(unsigned int index) const {
        Window w;
        if (index >= Count())
            return w;
        const unsigned int column = index % Columns();
        const unsigned int row = index / Columns();
        w.x = column * tileWidth;
        w.y = row * tileHeight;
        w.width = std::min(tileWidth, width - w.x);
        w.height = std::min(tileHeight, height - w.y);
        return w;
    }

    // The index of the tile holding (x, y), or Count() when outside.
    unsigned int Find(unsigned int x, unsigned int y) const {
        if (x >= width || y >= height)
            return Count();
        return (y / tileHeight) * Columns() + x / tileWidth;
    }
};

}  // namespace datasources
}  // namespace kestrel
