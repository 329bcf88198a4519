#include "platform/types/ActivationRule.h"

#include <algorithm>
#include <cstdint>
#include <optional>
#include <string_view>
#include <utility>
#include <vector>

namespace qm {

namespace {

// An integer count, with everything below 1 read as 0 (nothing offered,
// nothing admitted); nothing for a value that is not an integer.
std::optional<std::uint64_t> count(const Value& value) {
    switch (value.type()) {
        case ValueType::unsignedInteger: return value.asUnsigned();
        case ValueType::signedInteger: return value.asUnsigned().value_or(0);
        default: return std::nullopt;
    }
}

struct Limit {
    std::string_view type;
    std::uint64_t most = 0;
};

}  // namespace

bool activationRuleMatches(const Value& rule, const Value& description, const UniformTypes& types) {
    const Dictionary* limits = rule.asDictionary();
    const Dictionary* offer = description.asDictionary();
    if (limits == nullptr || offer == nullptr) {
        return false;
    }
    std::vector<Limit> admitted;
    admitted.reserve(limits->size());
    for (const auto& [type, value] : *limits) {
        auto most = count(value);
        if (!most) {
            return false;
        }
        admitted.push_back({type, *most});
    }
    bool offersSomething = false;
    for (const auto& entry : *offer) {
        // Named rather than bound: the lambda below takes the type, and not
        // every compiler lets a lambda capture a structured binding yet.
        const auto& offeredType = entry.first;
        auto offered = count(entry.second);
        if (!offered) {
            return false;
        }
        if (*offered == 0) {
            continue;
        }
        offersSomething = true;
        auto takes = [&](const Limit& limit) {
            return limit.most >= *offered && types.conforms(offeredType, limit.type);
        };
        if (std::none_of(admitted.begin(), admitted.end(), takes)) {
            return false;
        }
    }
    return offersSomething;
}

}  // namespace qm
