// Posts held in memory as one block.
#pragma once

#include <memory>
#include <utility>

#include "griddem.h"

namespace kestrel {
namespace dem {
namespace detail {

class MemoryPosts final : public PostSource {
  public:
    explicit MemoryPosts(std::shared_ptr<const PostBlock> block) { Replace(std::move(block)); }

    std::shared_ptr<const PostBlock> GetBlock(unsigned int, unsigned int) const override {
        return block_;
    }

    // Not while another thread reads the posts.
    void Replace(std::shared_ptr<const PostBlock> block) {
        block_ = std::move(block);
        width = blockWidth = block_->width;
        height = blockHeight = block_->height;
    }

  private:
    std::shared_ptr<const PostBlock> block_;
};

}  // namespace detail
}  // namespace dem
}  // namespace kestrel
