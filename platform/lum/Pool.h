#pragma once

#include <cstddef>
#include <map>
#include <memory>
#include <mutex>
#include <optional>

#include "platform/lum/Origin.h"

namespace platform {

/// A number of things that all peers draw from. One origin has at most a quarter of them, or fewer,
/// so that nobody keeps the others out. From any thread.
class Pool {
  public:
    /// What somebody has drawn at a time; given back at its end, also after the pool's.
    class Share {
      public:
        Share(Share&&) noexcept = default;
        Share& operator=(Share&& other) noexcept;
        ~Share();

        const Origin& origin() const { return origin_; }

      private:
        friend class Pool;
        struct State;
        Share(std::shared_ptr<State> state, const Origin& origin, std::size_t count)
            : state_(std::move(state)), origin_(origin), count_(count) {}

        std::shared_ptr<State> state_;
        Origin origin_;
        std::size_t count_;
    };

    explicit Pool(std::size_t size) : Pool(size, size < 4 ? 1 : size / 4) {}
    /// One of which an origin has so many at the most.
    Pool(std::size_t size, std::size_t mostOfOne);

    /// Draws so many at once; none when there are not as many, or the origin would have more than
    /// its part.
    std::optional<Share> draw(const Origin& origin, std::size_t count = 1);
    /// As many as one origin may have.
    std::size_t mostOfOne() const;

  private:
    std::shared_ptr<Share::State> state_;
};

}  // namespace platform
