#include "platform/values/LazyDictionary.h"

#include "platform/values/Cbor.h"

namespace platform {

LazyDictionary::LazyDictionary(Dictionary dictionary) : state_(std::make_shared<State>()) {
    state_->dictionary = std::move(dictionary);
}

LazyDictionary::LazyDictionary(EncodedBytes bytes, FaultHandler onFault) {
    constexpr std::string_view kEmpty = "\xA0";
    if (bytes.bytes == kEmpty) return;
    state_ = std::make_shared<State>();
    state_->isEncoded = true;
    state_->bytes = std::move(bytes);
    state_->onFault = onFault;
}

const Dictionary& LazyDictionary::get() const {
    static const Dictionary kNone;
    if (!state_) return kNone;
    // A finished flag costs a system call to set, which records without bytes need not pay.
    if (!state_->isEncoded) return state_->dictionary;
    std::call_once(state_->once, [&state = *state_] {
        auto value = decodeCbor(state.bytes, CborOptions::KeepEncoded);
        if (!value) {
            state.onFault(describe(value.error()));
        } else if (const Dictionary* dictionary = value->dictionary()) {
            state.dictionary = *dictionary;
        } else {
            state.onFault("it holds another kind of value");
        }
        state.isDecoded.store(true, std::memory_order_release);
    });
    return state_->dictionary;
}

void LazyDictionary::look(const std::function<void(const Dictionary&)>& see) const {
    if (!state_ || !state_->isEncoded || state_->isDecoded.load(std::memory_order_acquire))
        return see(get());
    // Who looks while another thread decodes reads the same bytes: these stay.
    const auto value = decodeCbor(state_->bytes, CborOptions::Plain);
    see(value && value->dictionary() ? *value->dictionary() : get());
}

}  // namespace platform
