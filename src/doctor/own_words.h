// The words of the doctor's own sentences.
#ifndef PELORUS_DOCTOR_OWN_WORDS_H
#define PELORUS_DOCTOR_OWN_WORDS_H

#include <cstddef>
#include <string_view>

namespace pelorus::doctor {

/// True when the @p length characters at @p at are one of these words, or a part of one, and stand
/// as in a sentence: with blanks and punctuation around the word, and not where the sentence repeats
/// what others said. What others call so, too, is then no more than a word.
[[nodiscard]] bool isOwnWord(std::string_view text, std::size_t at, std::size_t length);

}  // namespace pelorus::doctor

#endif
