#include "krutil/terminal/LineEditor.hpp"

#include <histedit.h>
#include <poll.h>
#include <unistd.h>

#include <cerrno>
#include <clocale>
#include <cstdio>
#include <cwchar>
#include <exception>
#include <functional>
#include <optional>
#include <stdexcept>
#include <string_view>
#include <type_traits>
#include <utility>
#include <vector>

#include "krutil/base/Text.hpp"
#include "krutil/terminal/EditedText.hpp"
#include "krutil/terminal/Highlight.hpp"
#include "krutil/terminal/HistorySearch.hpp"
#include "krutil/terminal/LineDisplay.hpp"
#include "krutil/terminal/LineHistory.hpp"
#include "krutil/terminal/PythonInput.hpp"
#include "krutil/terminal/TerminalRestorer.hpp"

namespace krutil_client {
namespace {

// Has a terminal mark what is pasted, so that newlines in it are no Enter.
constexpr const char* markPastes = "\x1b[?2004h";
constexpr const char* markNoPastes = "\x1b[?2004l";
constexpr const wchar_t* pasteBegins = L"\x1b[200~";
constexpr std::wstring_view pasteEnds = L"\x1b[201~";
constexpr const char* clearTerminal = "\x1b[H\x1b[2J";
constexpr char endOfInput = 4;
constexpr const char* beep = "\a";
constexpr const wchar_t* olderKey = L"^P";
constexpr const wchar_t* newerKey = L"^N";
// What these keys send.
constexpr const wchar_t* older = L"\x10";
constexpr const wchar_t* newer = L"\x0e";
constexpr const wchar_t* continuation = L"... ";

std::string withUtf8(std::string text) {
    std::setlocale(LC_CTYPE, "C.UTF-8");
    return text;
}

bool readable(int descriptor) {
    pollfd watched{descriptor, POLLIN, 0};
    return ::poll(&watched, 1, 0) == 1;
}

}  // namespace

// The library does what keys mean. What it would write goes nowhere: it cannot take its line away and show it again,
// and takes characters of no width for ones of width one.
class LineEditor::Impl {
  public:
    Impl(Output& out, LastLine& lastLine, std::string historyFile, bool color)
        : color_(color),
          out_(out),
          lastLine_(lastLine),
          codeHistory_(withUtf8(std::move(historyFile))),
          noHistory_(std::string()),
          nowhere_(std::fopen("/dev/null", "we"), &std::fclose) {
        if (nowhere_) {
            editor_ = ::el_init_fd("krutil", stdin, nowhere_.get(), nowhere_.get(), STDIN_FILENO, STDOUT_FILENO,
                                   STDERR_FILENO);
        }
        if (editor_ == nullptr) {
            throw std::runtime_error("the line editor cannot be set up");
        }
        ::el_wset(editor_, EL_CLIENTDATA, this);
        ::el_wset(editor_, EL_EDITOR, L"emacs");
        // Signals are the program's own to handle.
        ::el_wset(editor_, EL_SIGNAL, 0);
        ::el_wset(editor_, EL_GETCFN, &Impl::getCharacter);
        bindKeys();
    }

    ~Impl() { ::el_end(editor_); }

    Impl(const Impl&) = delete;
    Impl& operator=(const Impl&) = delete;

    const std::string& historyRefusal() const noexcept { return codeHistory_.refusal(); }

    void type(const std::string& keys) { ::el_wpush(editor_, toWide(keys).c_str()); }

    ReadLine read(Conversation& conversation, const Complete& complete, For what, const std::string& prompt,
                  const std::function<bool()>& done) {
        conversation_ = &conversation;
        complete_ = &complete;
        what_ = what;
        done_ = &done;
        lastTab_.reset();
        doneSeen_ = false;
        error_ = nullptr;
        text_.clear();
        cursor_ = 0;
        settleLastLine();
        show(display_.begin(toWide(lastLine_.text()), out_.terminalSize()));
        prompt_ = toWide(what == For::Input ? lastLine_.take() + prompt : prompt);
        away_ = false;
        ::el_wset(editor_, EL_HIST, &::history_w, history().get());
        const wchar_t* typed = nullptr;
        int count = 0;
        {
            TerminalRestorer restorer(markNoPastes);
            const Shown shown(*this, restorer);
            ::el_wset(editor_, EL_PREP_TERM, 1);
            show(markPastes);
            if (readable(STDIN_FILENO)) {
                // The terminal has shown it by itself.
                display_.doubt();
            }
            if (what == For::Code && !unfinished_.empty()) {
                // As it would be pasted: newlines in it are no Enter.
                ::el_wpush(editor_, (pasteBegins + std::exchange(unfinished_, {}) + std::wstring(pasteEnds)).c_str());
            }
            typed = ::el_wgets(editor_, &count);
        }
        if (typed != nullptr) {
            // What Enter has inserted ends without a null character.
            text_.assign(typed, static_cast<std::size_t>(count));
            if (what == For::Code && text_.find_first_not_of(L" \t\n") != std::wstring::npos) {
                codeHistory_.add(text_.c_str());
            }
            if (!text_.empty() && text_.back() == L'\n') {
                text_.pop_back();
            }
        }
        leave();
        if (error_) {
            if (what == For::Code && !isLineDropped(error_)) {
                unfinished_ = text_;
            }
            std::rethrow_exception(error_);
        }
        if (typed == nullptr) {
            return {doneSeen_ ? ReadLine::End::Done : ReadLine::End::EndOfInput, {}};
        }
        return {ReadLine::End::Newline, toUtf8(text_)};
    }

  private:
    // The line is shown whenever the conversation waits, as long as this lives.
    class Shown {
      public:
        Shown(Impl& editor, TerminalRestorer& restorer)
            : editor_(editor),
              before_(editor.conversation_->setPastime({{},
                                                        nullptr,
                                                        [&editor] { editor.takeAway(); },
                                                        [&editor, &restorer] { editor.bringBack(restorer); }})) {}
        ~Shown() { editor_.conversation_->setPastime(std::move(before_)); }
        Shown(const Shown&) = delete;
        Shown& operator=(const Shown&) = delete;

      private:
        Impl& editor_;
        Conversation::Pastime before_;
    };

    static Impl& of(EditLine* editor) {
        void* self = nullptr;
        ::el_wget(editor, EL_CLIENTDATA, &self);
        return *static_cast<Impl*>(self);
    }

    // A function of this class, or one of EditedText that always succeeds. Exceptions must not pass through the
    // library, so they are kept for read().
    template <auto action>
    void bind(const wchar_t* name, const std::vector<const wchar_t*>& keys) {
        unsigned char (*const function)(EditLine*, wint_t) = [](EditLine* editor, wint_t) -> unsigned char {
            Impl& self = of(editor);
            try {
                if constexpr (std::is_invocable_v<decltype(action), EditedText&>) {
                    EditedText edited(editor);
                    std::invoke(action, edited);
                    return CC_REFRESH;
                } else {
                    return std::invoke(action, self);
                }
            } catch (...) {
                self.error_ = std::current_exception();
                self.takeText();
                return CC_EOF;
            }
        };
        ::el_wset(editor_, EL_ADDFN, name, L"", function);
        bindTo(name, keys);
    }

    void bindTo(const wchar_t* name, const std::vector<const wchar_t*>& keys) {
        for (const wchar_t* const key : keys) {
            ::el_wset(editor_, EL_BIND, key, name, nullptr);
        }
    }

    void bindKeys() {
        bind<&Impl::paste>(L"paste", {pasteBegins});
        bind<&Impl::clear>(L"clear-all", {L"^L"});
        bind<&Impl::enter>(L"enter", {L"^M", L"^J"});
        bind<&Impl::tab>(L"tab", {L"\t"});
        bind<&Impl::up>(L"up", {L"\x1b[A", L"\x1bOA"});
        bind<&Impl::down>(L"down", {L"\x1b[B", L"\x1bOB"});
        bind<&EditedText::moveToLineBegin>(L"line-begin", {L"^A", L"\x1b[H", L"\x1bOH", L"\x1b[1~"});
        bind<&EditedText::moveToLineEnd>(L"line-end", {L"^E", L"\x1b[F", L"\x1bOF", L"\x1b[4~"});
        bind<&EditedText::eraseBack>(L"erase-back", {L"^?", L"^H"});
        bind<&EditedText::eraseToLineBegin>(L"erase-to-line-begin", {L"^U"});
        bind<&EditedText::eraseToLineEnd>(L"erase-to-line-end", {L"^K"});
        bindTo(L"em-set-mark", {EditedText::markKey});
        bindTo(L"em-kill-region", {EditedText::eraseToMarkKey});
        bindTo(L"ed-delete-prev-word", {L"^W"});
        bind<&Impl::search>(L"search", {L"^R"});
        bindTo(L"ed-prev-history", {olderKey});
        bindTo(L"ed-next-history", {newerKey});
        bindTo(L"ed-delete-next-char", {L"\x1b[3~"});
        bindTo(L"ed-prev-word", {L"\x1b[1;5D"});
        bindTo(L"em-next-word", {L"\x1b[1;5C"});
    }

    // Exceptions must not pass through here either.
    static int getCharacter(EditLine* editor, wchar_t* character) {
        Impl& self = of(editor);
        int result = -1;
        try {
            result = self.nextCharacter(*character);
        } catch (...) {
            self.error_ = std::current_exception();
        }
        if (result != 1) {
            self.takeText();
        }
        return result;
    }

    int nextCharacter(wchar_t& character) {
        passMarks();
        std::mbstate_t state{};
        for (;;) {
            if (!conversation_->runUntilReadable(STDIN_FILENO, *done_)) {
                doneSeen_ = true;
                return -1;
            }
            char byte = 0;
            const auto got = ::read(STDIN_FILENO, &byte, 1);
            if (got < 0 && (errno == EINTR || errno == EAGAIN)) {
                continue;
            }
            if (got < 0) {
                failReading();
            }
            if (got == 0) {
                return 0;
            }
            if (byte == '\0') {
                // What a Ctrl-D becomes that was pressed before the terminal was set up.
                byte = endOfInput;
            }
            const auto length = std::mbrtowc(&character, &byte, 1, &state);
            if (length == static_cast<std::size_t>(-1)) {
                state = {};
            } else if (length != static_cast<std::size_t>(-2)) {
                return 1;
            }
        }
    }

    // What has no width belongs to the character before; the cursor goes on past both.
    void passMarks() {
        const LineInfoW* const line = ::el_wline(editor_);
        const wchar_t* at = line->cursor;
        const int step = static_cast<std::size_t>(at - line->buffer) < cursor_ ? -1 : 1;
        while (at > line->buffer && at < line->lastchar && ::wcwidth(*at) == 0) {
            ::el_cursor(editor_, step);
            at += step;
        }
        cursor_ = static_cast<std::size_t>(at - line->buffer);
    }

    void takeText() {
        const LineInfoW* const line = ::el_wline(editor_);
        text_.assign(line->buffer, line->lastchar);
    }

    unsigned char paste() {
        std::wstring pasted;
        while (!pasted.ends_with(pasteEnds)) {
            wchar_t character = L'\0';
            if (::el_wgetc(editor_, &character) != 1) {
                return CC_EOF;
            }
            // Terminals paste a newline as the key Enter.
            pasted += character == L'\r' ? L'\n' : character;
        }
        pasted.resize(pasted.size() - pasteEnds.size());
        return pasted.empty() || ::el_winsertstr(editor_, pasted.c_str()) == 0 ? CC_REFRESH : CC_ERROR;
    }

    unsigned char clear() {
        lastLine_.take();
        show(clearTerminal + display_.begin({}, out_.terminalSize()));
        return CC_NORM;
    }

    static unsigned char refreshed(bool done) { return done ? CC_REFRESH : CC_ERROR; }

    unsigned char enter() {
        EditedText edited(editor_);
        const std::wstring text = edited.text();
        if (what_ == For::Code && (edited.lineEnd() < text.size() || !isWhole(toUtf8(text)))) {
            // What comes faster than it is typed has its own indentation.
            const bool typed = !readable(STDIN_FILENO);
            const std::string before = toUtf8(text.substr(0, edited.cursor()));
            return refreshed(edited.insert(L"\n" + (typed ? toWide(indentationAfter(before)) : std::wstring())));
        }
        edited.moveTo(text.size());
        if (edited.lineBegin() > 0 && edited.inIndentation()) {
            edited.replace(edited.lineBegin(), text.size(), {});
        }
        return edited.insert(L"\n") ? CC_NEWLINE : CC_ERROR;
    }

    unsigned char up() {
        if (!EditedText(editor_).moveUp()) {
            ::el_wpush(editor_, older);
        }
        return CC_REFRESH;
    }

    unsigned char down() {
        if (!EditedText(editor_).moveDown()) {
            ::el_wpush(editor_, newer);
        }
        return CC_REFRESH;
    }

    unsigned char tab() {
        EditedText edited(editor_);
        const bool asks = what_ == For::Code && *complete_ && !edited.inIndentation();
        const auto found = asks ? (*complete_)(edited.text(), edited.cursor()) : std::nullopt;
        if (!found) {
            return refreshed(edited.indent());
        }
        const std::wstring common = commonBeginning(found->candidates);
        const bool longer = found->candidates.size() == 1 || found->start + common.size() > edited.cursor();
        if (longer && edited.text().compare(found->start, found->end - found->start, common) != 0) {
            edited.replace(found->start, found->end, common);
        } else if (found->candidates.size() > 1 && lastTab_ == edited.text()) {
            list(found->candidates);
        } else {
            show(beep);
        }
        lastTab_ = edited.text();
        return CC_REFRESH;
    }

    // Above the line, where it stays.
    void list(const std::vector<std::wstring>& candidates) {
        takeAway();
        out_.write((lastLine_.text().empty() ? "" : "\n") + toUtf8(tableOf(candidates, out_.terminalSize().columns)));
    }

    // Shows what is found until another key comes: Ctrl-G goes back, any other does with the entry what it does.
    unsigned char search() {
        constexpr wchar_t giveUp = L'\x07';
        EditedText edited(editor_);
        HistorySearch search(history(), edited.text());
        const std::wstring prompt = prompt_;
        wchar_t key = L'\0';
        do {
            edited.replace(0, edited.text().size(), search.text());
            edited.moveTo(search.place());
            prompt_ = search.prompt();
            if (::el_wgetc(editor_, &key) != 1) {
                prompt_ = prompt;
                return CC_EOF;
            }
        } while (search.take(key));
        prompt_ = prompt;
        if (key == giveUp) {
            edited.replace(0, edited.text().size(), search.before());
            return CC_REFRESH;
        }
        if (key == L'\r' || key == L'\n') {
            edited.moveTo(edited.text().size());
        }
        ::el_wpush(editor_, std::wstring(1, key).c_str());
        return CC_REFRESH;
    }

    LineHistory& history() { return what_ == For::Code ? codeHistory_ : noHistory_; }

    void show(const std::string& text) {
        if (!text.empty()) {
            out_.show(text);
        }
    }

    // What was written last stands before the prompt, if it is known where that leaves the cursor.
    void settleLastLine() {
        if (!lastLine_.whole() || !LineDisplay::measures(toWide(lastLine_.text()))) {
            lastLine_.take();
            show("\n");
        }
    }

    // Leaves the terminal as it would be without the line, for what is written next.
    void takeAway() {
        if (!away_) {
            show(display_.show({toWide(lastLine_.text())}, out_.terminalSize()));
            away_ = true;
        }
    }

    void bringBack(TerminalRestorer& restorer) {
        if (restorer.wasStopped()) {
            // Others have used the terminal meanwhile.
            ::el_wset(editor_, EL_PREP_TERM, 0);
            ::el_wset(editor_, EL_PREP_TERM, 1);
            lastLine_.take();
            show(markPastes + display_.begin({}, out_.terminalSize()));
            away_ = false;
        }
        // Not between keys that come together, as those of a paste do.
        if (!readable(STDIN_FILENO)) {
            takeText();
            draw(cursor_, cursor_);
        }
    }

    // A bracket at `marked` is shown with the one that belongs to it.
    void draw(std::size_t cursor, std::size_t marked) {
        if (away_) {
            settleLastLine();
            show(display_.begin(toWide(lastLine_.text()), out_.terminalSize()));
            away_ = false;
        }
        LineDisplay::Line line{toWide(lastLine_.text()) + prompt_, text_, cursor};
        if (what_ == For::Code) {
            line.continuation = continuation;
            line.styles = color_ ? stylesOf(text_, marked) : std::vector<Style>();
        }
        show(display_.show(line, out_.terminalSize()));
    }

    // Shows all of the line once more, and begins a new one.
    void leave() {
        draw(text_.size(), std::wstring::npos);
        lastLine_.take();
        show(std::string(markNoPastes) + (isLineDropped(error_) ? "^C\n" : "\n"));
    }

    Conversation* conversation_ = nullptr;
    const Complete* complete_ = nullptr;
    For what_ = For::Code;
    const bool color_;
    Output& out_;
    LastLine& lastLine_;
    LineHistory codeHistory_;
    LineHistory noHistory_;
    std::unique_ptr<FILE, int (*)(FILE*)> nowhere_;
    EditLine* editor_ = nullptr;
    LineDisplay display_;
    std::wstring prompt_;
    std::wstring text_;
    std::wstring unfinished_;  ///< code whose session has ended while it was typed; the next one begins with it
    std::size_t cursor_ = 0;
    bool away_ = false;                    ///< taken away
    std::optional<std::wstring> lastTab_;  ///< what the last Tab has left
    const std::function<bool()>* done_ = nullptr;
    bool doneSeen_ = false;
    std::exception_ptr error_;
};

LineEditor::LineEditor(Output& out, LastLine& lastLine, std::string historyFile, bool color)
    : impl_(std::make_unique<Impl>(out, lastLine, std::move(historyFile), color)) {}

LineEditor::~LineEditor() = default;

ReadLine LineEditor::read(Conversation& conversation, const Complete& complete, For what, const std::string& prompt,
                          const std::function<bool()>& done) {
    return impl_->read(conversation, complete, what, prompt, done);
}

const std::string& LineEditor::historyRefusal() const noexcept {
    return impl_->historyRefusal();
}

void LineEditor::type(const std::string& keys) {
    impl_->type(keys);
}

}  // namespace krutil_client
