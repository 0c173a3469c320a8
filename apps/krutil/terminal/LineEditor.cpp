#include "krutil/terminal/LineEditor.hpp"

#include <histedit.h>
#include <poll.h>
#include <unistd.h>

#include <cerrno>
#include <clocale>
#include <cstdio>
#include <cstdlib>
#include <cwchar>
#include <exception>
#include <filesystem>
#include <stdexcept>
#include <string_view>

#include "krutil/base/Text.hpp"
#include "krutil/terminal/LineDisplay.hpp"
#include "krutil/terminal/LineHistory.hpp"
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
constexpr const wchar_t* indentation = L"    ";

std::string withUtf8(std::string text) {
    std::setlocale(LC_CTYPE, "C.UTF-8");
    return text;
}

bool readable(int descriptor) {
    pollfd watched{descriptor, POLLIN, 0};
    return ::poll(&watched, 1, 0) == 1;
}

struct Close {
    void operator()(FILE* file) const noexcept { std::fclose(file); }
};

}  // namespace

// The library does what keys mean. What it would write goes nowhere: it cannot take its line away and show it again,
// and takes characters of no width for ones of width one.
class LineEditor::Impl {
  public:
    Impl(Conversation& conversation, Output& out, LastLine& lastLine, std::string historyFile)
        : conversation_(conversation),
          out_(out),
          lastLine_(lastLine),
          codeHistory_(withUtf8(std::move(historyFile))),
          noHistory_(std::string()),
          nowhere_(std::fopen("/dev/null", "we")) {
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
        ::el_wset(editor_, EL_BIND, L"^R", L"em-inc-search-prev", nullptr);
        bind<&Impl::paste>(L"paste", pasteBegins);
        bind<&Impl::clear>(L"clear-all", L"^L");
        bind<&Impl::indent>(L"indent", L"\t");
    }

    ~Impl() { ::el_end(editor_); }

    Impl(const Impl&) = delete;
    Impl& operator=(const Impl&) = delete;

    ReadLine read(For what, const std::string& prompt, const std::function<bool()>& done) {
        done_ = &done;
        doneSeen_ = false;
        error_ = nullptr;
        text_.clear();
        cursor_ = 0;
        settleLastLine();
        show(display_.begin(toWide(lastLine_.text()), size()));
        prompt_ = toWide(what == For::Input ? lastLine_.take() + prompt : prompt);
        away_ = false;
        ::el_wset(editor_, EL_HIST, &::history_w, (what == For::Code ? codeHistory_ : noHistory_).get());
        const wchar_t* typed = nullptr;
        {
            TerminalRestorer restorer(markNoPastes);
            const Shown shown(*this, restorer);
            ::el_wset(editor_, EL_PREP_TERM, 1);
            show(markPastes);
            if (readable(STDIN_FILENO)) {
                // The terminal has shown it by itself.
                display_.doubt();
            }
            int count = 0;
            typed = ::el_wgets(editor_, &count);
        }
        if (typed != nullptr) {
            text_ = typed;
            if (!text_.empty() && text_.back() == L'\n') {
                text_.pop_back();
            }
            if (what == For::Code && text_.find_first_not_of(L" \t\n") != std::wstring::npos) {
                codeHistory_.add(typed);
            }
        }
        leave();
        if (error_) {
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
              before_(editor.conversation_.setPastime({{},
                                                       nullptr,
                                                       [&editor] { editor.takeAway(); },
                                                       [&editor, &restorer] { editor.bringBack(restorer); }})) {}
        ~Shown() { editor_.conversation_.setPastime(std::move(before_)); }
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

    template <unsigned char (Impl::*action)()>
    void bind(const wchar_t* name, const wchar_t* key) {
        unsigned char (*const function)(EditLine*, wint_t) = [](EditLine* editor, wint_t) {
            return (of(editor).*action)();
        };
        ::el_wset(editor_, EL_ADDFN, name, L"", function);
        ::el_wset(editor_, EL_BIND, key, name, nullptr);
    }

    // Exceptions must not pass through the library, so they are kept for read().
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
            if (!conversation_.runUntilReadable(STDIN_FILENO, *done_)) {
                doneSeen_ = true;
                return -1;
            }
            char byte = 0;
            const auto got = ::read(STDIN_FILENO, &byte, 1);
            if (got < 0 && (errno == EINTR || errno == EAGAIN)) {
                continue;
            }
            if (got <= 0) {
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
        show(clearTerminal + display_.begin({}, size()));
        return CC_NORM;
    }

    unsigned char indent() { return ::el_winsertstr(editor_, indentation) == 0 ? CC_REFRESH : CC_ERROR; }

    LineDisplay::Size size() const { return {out_.columns(), out_.rows()}; }

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
            show(display_.show({toWide(lastLine_.text())}, size()));
            away_ = true;
        }
    }

    void bringBack(TerminalRestorer& restorer) {
        if (restorer.wasStopped()) {
            // Others have used the terminal meanwhile.
            ::el_wset(editor_, EL_PREP_TERM, 0);
            ::el_wset(editor_, EL_PREP_TERM, 1);
            lastLine_.take();
            show(markPastes + display_.begin({}, size()));
            away_ = false;
        }
        // Not between keys that come together, as those of a paste do.
        if (!readable(STDIN_FILENO)) {
            takeText();
            draw(cursor_);
        }
    }

    void draw(std::size_t cursor) {
        if (away_) {
            settleLastLine();
            show(display_.begin(toWide(lastLine_.text()), size()));
            away_ = false;
        }
        show(display_.show({toWide(lastLine_.text()) + prompt_, text_, cursor}, size()));
    }

    // Shows all of the line once more, and begins a new one.
    void leave() {
        draw(text_.size());
        lastLine_.take();
        show(std::string(markNoPastes) + (wasDropped() ? "^C\n" : "\n"));
    }

    bool wasDropped() const {
        try {
            if (error_) {
                std::rethrow_exception(error_);
            }
        } catch (const LineDropped&) {
            return true;
        } catch (...) {
        }
        return false;
    }

    Conversation& conversation_;
    Output& out_;
    LastLine& lastLine_;
    LineHistory codeHistory_;
    LineHistory noHistory_;
    std::unique_ptr<FILE, Close> nowhere_;
    EditLine* editor_ = nullptr;
    LineDisplay display_;
    std::wstring prompt_;
    std::wstring text_;
    std::size_t cursor_ = 0;
    bool away_ = false;  ///< taken away
    const std::function<bool()>* done_ = nullptr;
    bool doneSeen_ = false;
    std::exception_ptr error_;
};

LineEditor::LineEditor(Conversation& conversation, Output& out, LastLine& lastLine, std::string historyFile)
    : impl_(std::make_unique<Impl>(conversation, out, lastLine, std::move(historyFile))) {}

LineEditor::~LineEditor() = default;

ReadLine LineEditor::read(For what, const std::string& prompt, const std::function<bool()>& done) {
    return impl_->read(what, prompt, done);
}

std::string defaultHistoryFile() {
    const auto variable = [](const char* name) {
        const char* const value = std::getenv(name);
        return std::string(value != nullptr ? value : "");
    };
    if (const std::string state = variable("XDG_STATE_HOME"); !state.empty() && state[0] == '/') {
        return (std::filesystem::path(state) / "krutil" / "history").string();
    }
    const std::string home = variable("HOME");
    return home.empty() ? std::string() : (std::filesystem::path(home) / ".local/state/krutil/history").string();
}

}  // namespace krutil_client
