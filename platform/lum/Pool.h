#pragma once

#include <cstddef>
#include <map>
#include <memory>
#include <mutex>
#include <optional>

#include "platform/lum/Origin.h"

namespace platform {

/// A number of things that all peers draw from. One origin has at most a quarter of them, so that
/// nobody keeps the others out. From any thread.
class Pool {
  public:
    /// What somebody has drawn; given back at its end, also after the pool's.
    class Share {
      public:
        Share(Share&&) noexcept = default;
        Share& operator=(Share&& other) noexcept;
        ~Share();

        const Origin& origin() const { return origin_; }

      private:
        friend class Pool;
        struct State;
        Share(std::shared_ptr<State> state, const Origin& origin)
            : state_(std::move(state)), origin_(origin) {}

        std::shared_ptr<State> state_;
        Origin origin_;
    };

    explicit Pool(std::size_t size);

    /// Draws one; none when the pool is empty or the origin has its quarter already.
    std::optional<Share> draw(const Origin& origin);
    /// As many as one origin may have.
    std::size_t quarter() const;

  private:
    std::shared_ptr<Share::State> state_;
};

}  // namespace platform
