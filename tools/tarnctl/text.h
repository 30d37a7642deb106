// Terminal text for tarnctl: UTF-8 decoded with the C library in a UTF-8
// locale, widths in display columns as wcwidth() gives them (East Asian wide
// characters take two columns, combining marks none), cuts only between
// characters, and never invalid UTF-8 on output.
#ifndef TARNCTL_TEXT_H
#define TARNCTL_TEXT_H

#include <string>

// Selects a UTF-8 character type for the decoding (C.UTF-8 when the
// user's locale is not UTF-8). Call once at start.
void TextInit();

// text with every byte that is not part of a valid UTF-8 character, and
// every control character, replaced by U+FFFD.
std::string TextClean(const std::string &text);

// Display columns of (cleaned) text.
int TextWidth(const std::string &text);

// The text cut to at most columns display columns; when it had to be cut
// its last column shows "…". Combining marks stay with their character.
std::string TextCut(const std::string &text, int columns);

// TextCut, then padded with blanks to exactly columns columns (left
// aligned, or right aligned when right is true).
std::string TextFit(const std::string &text, int columns, bool right = false);

// Lower-case form for matching words (ASCII and the C library's towlower).
std::string TextFold(const std::string &text);

#endif
