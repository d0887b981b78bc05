#include "Client/ctl/Suggestion.h"

#include "Client/ctl/Output.h"

#include <algorithm>
#include <vector>

namespace ostrand::ctl {

namespace {

/// What is longer was not meant as one of our names, and comparing takes the product of both lengths.
constexpr std::size_t longestWord = 256;

std::string lowered(std::string_view text) {
    std::string out(text);
    for (char& letter : out)
        if (letter >= 'A' && letter <= 'Z')
            letter = static_cast<char>(letter - 'A' + 'a');
    return out;
}

/// How many letters must be inserted, dropped, changed or exchanged with their neighbour to make one word the other.
std::size_t distance(std::string_view one, std::string_view other) {
    std::vector<std::size_t> beforeLast(other.size() + 1), last(other.size() + 1), row(other.size() + 1);
    for (std::size_t j = 0; j <= other.size(); ++j)
        row[j] = j;
    for (std::size_t i = 1; i <= one.size(); ++i) {
        std::swap(beforeLast, last);
        std::swap(last, row);
        row[0] = i;
        for (std::size_t j = 1; j <= other.size(); ++j) {
            row[j] = std::min({last[j] + 1, row[j - 1] + 1, last[j - 1] + (one[i - 1] == other[j - 1] ? 0 : 1)});
            if (i > 1 && j > 1 && one[i - 1] == other[j - 2] && one[i - 2] == other[j - 1])
                row[j] = std::min(row[j], beforeLast[j - 2] + 1);
        }
    }
    return row.back();
}

const std::string* nearest(std::string_view word, std::span<const std::string> candidates) {
    const std::string* best = nullptr;
    auto closest = std::max<std::size_t>(1, word.size() / 3) + 1;
    for (const auto& candidate : candidates) {
        if (candidate.size() > longestWord)
            continue;
        if (const auto away = distance(word, lowered(candidate)); away < closest) {
            closest = away;
            best = &candidate;
        }
    }
    return best;
}

/// The only candidate that contains the word.
const std::string* onlyWith(std::string_view word, std::span<const std::string> candidates) {
    const auto contains = [&](const std::string& candidate) { return lowered(candidate).contains(word); };
    if (word.empty() || std::ranges::count_if(candidates, contains) != 1)
        return nullptr;
    return &*std::ranges::find_if(candidates, contains);
}

} // namespace

std::string didYouMean(std::string_view word, std::span<const std::string> candidates) {
    if (word.size() > longestWord)
        return {};
    const auto wanted = lowered(word);
    const auto* const container = onlyWith(wanted, candidates);
    const auto* const best = container ? container : nearest(wanted, candidates);
    return best ? "; did you mean \"" + escaped(*best) + "\"?" : "";
}

} // namespace ostrand::ctl
