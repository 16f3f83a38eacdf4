// The image-space z-buffer of the true-ortho generator.
//
// Surface cells (triangles between neighbouring ground points) are projected into the image and
// rasterised at pixel centres, each pixel keeping the highest surface that covers it. Along a
// ray from a sensor above the ground the higher point is the nearer one, so the height serves
// as depth for frame cameras and RPC models alike. Projecting cells rather than points leaves no
// gaps between posts that let hidden ground shine through at breaklines.
#pragma once

#include <vector>

namespace kestrel {
namespace processes {
namespace trueortho {

class ZBuffer {
  public:
    // Covers image pixels [x0, x0 + width) x [y0, y0 + height), empty of surface.
    void Reset(int x0, int y0, int width, int height);
    // A surface triangle: image positions (continuous, pixel centres at + 0.5) and heights.
    void AddTriangle(const double* col, const double* row, const double* height);
    // The lowest height that the surface kept at the pixel centre nearest an image position can
    // have at that position: the kept height less its slope in image space times the distance
    // to the centre; -infinity where the centre holds no surface. A ground point is seen when
    // its height is not below this by more than a tolerance: a surface through the point
    // itself never lies above it, so only a surface in front of the point hides it. Comparing
    // at the nearest centre puts hidden edges within half an image pixel.
    float SurfaceBound(double col, double row) const;

  private:
    int x0_ = 0, y0_ = 0, width_ = 0, height_ = 0;
    std::vector<float> z_;      // highest surface at each pixel centre
    std::vector<float> slope_;  // its height change per image pixel
};

}  // namespace trueortho
}  // namespace processes
}  // namespace kestrel
