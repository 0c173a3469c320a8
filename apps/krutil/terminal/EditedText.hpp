// The text that a line editor holds, which may have several lines.
#pragma once

#include <histedit.h>

#include <cstddef>
#include <string>

namespace krutil_client {

/// Changes the text of the library's editor and moves its cursor. Positions count characters from 0. Cheap to make;
/// for functions that are bound to keys.
class EditedText {
  public:
    /// How far a block is indented.
    static constexpr std::size_t indentation = 4;

    /// `editor` must outlive the object.
    explicit EditedText(EditLine* editor) noexcept : editor_(editor) {}

    std::wstring text() const;
    std::size_t cursor() const noexcept;

    void moveTo(std::size_t position);

    /// Puts `text` in the place of what is between the two positions, with the cursor behind it. False when there is no
    /// memory.
    bool replace(std::size_t begin, std::size_t end, const std::wstring& text);

    /// Inserts at the cursor.
    bool insert(const std::wstring& text) { return replace(cursor(), cursor(), text); }

    /// To the beginning and the end of the cursor's line.
    void moveToLineBegin() { moveTo(lineBegin()); }
    void moveToLineEnd() { moveTo(lineEnd()); }

    /// Moves to the line above or below, to the same column if that line has it. False when there is none.
    bool moveUp();
    bool moveDown();

    /// Where the cursor's line begins and ends.
    std::size_t lineBegin() const;
    std::size_t lineEnd() const;

    /// Whether the cursor's line has nothing but blanks before the cursor.
    bool inIndentation() const;

    /// Inserts blanks up to the next step of indentation.
    bool indent();

    /// Erases the character before the cursor; in the indentation, the blanks back to the last step of that.
    void eraseBack();

    /// Erases from the cursor to the beginning or the end of its line; what was erased can be brought back with Ctrl-Y.
    /// When nothing is there, the newline goes, and with it the line above or below begins or ends here. The library
    /// does it after the function that a key is bound to, by keys that must be bound to these functions of the library:
    /// em-set-mark and em-kill-region.
    void eraseToLineBegin();
    void eraseToLineEnd();
    static constexpr const wchar_t* markKey = L"\x1b[9001~";
    static constexpr const wchar_t* eraseToMarkKey = L"\x1b[9002~";

  private:
    void eraseAlong(const wchar_t* move);

    EditLine* editor_;
};

}  // namespace krutil_client
