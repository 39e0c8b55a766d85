// PixelBlocks: where on their way the rays of a block of pixels can meet anything at all.
//
//   camera <──────────── near ──┬───────┐── far      Boxes of tiles that matter are thrown on the picture,
//   the
//           8 x 8 pixels of     │ tiles │            large ones of the tree for what is far away; a block
//           rays                └───────┘            keeps the smallest and the largest of their distances
#pragma once

#include "Render/Camera.h"
#include "Render/Export.h"
#include "Render/FieldView.h"

#include <vector>

namespace VLN::Render {

class VLN_RENDER_API PixelBlocks {
public:
  static constexpr int kWidth = 8; ///< pixels

  /// Distances from the camera, in the world.
  struct Span {
    float near = 3.4e38f, far = 0;

    bool empty() const { return !(near < far); }
  };

  /// @param field Weighed: what has no weight is not looked at.
  /// @param toWorld From local space.
  /// @cost Looks at no tile that is smaller than two blocks, unless its parent is larger: about as many tiles
  /// as there are blocks, times what lies behind one another.
  PixelBlocks(FieldView const& field, Affine const& toWorld, Camera const& camera, int width, int height);

  /// Of the rays through a pixel: behind `near`, and before `far`, nothing has weight.
  Span const& at(int x, int y) const {
    return m_spans[static_cast<std::size_t>(y / kWidth) * static_cast<std::size_t>(m_across) +
                   static_cast<std::size_t>(x / kWidth)];
  }

private:
  int m_across;
  std::vector<Span> m_spans;
};

} // namespace VLN::Render
