#include "LineEditor.hpp"

#include <fcntl.h>
#include <histedit.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <clocale>
#include <cstdio>
#include <cstdlib>
#include <cwchar>
#include <exception>
#include <filesystem>
#include <stdexcept>

#include "Descriptor.hpp"

namespace client {
namespace {

constexpr int linesOfHistory = 1000;

std::string toUtf8(const wchar_t* text) {
    std::mbstate_t state{};
    std::string result;
    std::array<char, 16> bytes{};
    for (; *text != L'\0'; ++text) {
        const auto length = std::wcrtomb(bytes.data(), *text, &state);
        if (length == static_cast<std::size_t>(-1)) {
            result += "\uFFFD";
            state = {};
        } else {
            result.append(bytes.data(), length);
        }
    }
    return result;
}

}  // namespace

class LineEditor::Impl {
  public:
    Impl(Conversation& conversation, std::string historyFile)
        : conversation_(conversation), historyFile_(std::move(historyFile)) {
        std::setlocale(LC_CTYPE, "C.UTF-8");
        history_ = ::history_winit();
        editor_ = ::el_init("krutil", stdin, stdout, stderr);
        if (history_ == nullptr || editor_ == nullptr) {
            throw std::runtime_error("the line editor cannot be set up");
        }
        HistEventW event{};
        ::history_w(history_, &event, H_SETSIZE, linesOfHistory);
        ::history_w(history_, &event, H_SETUNIQUE, 1);
        if (!historyFile_.empty()) {
            ::history_w(history_, &event, H_LOAD, historyFile_.c_str());
        }
        ::el_wset(editor_, EL_CLIENTDATA, this);
        ::el_wset(editor_, EL_EDITOR, L"emacs");
        ::el_wset(editor_, EL_BIND, L"^R", L"em-inc-search-prev", nullptr);
        // Ctrl-C is the program's own to handle.
        ::el_wset(editor_, EL_SIGNAL, 0);
        ::el_wset(editor_, EL_HIST, &::history_w, history_);
        ::el_wset(editor_, EL_PROMPT, &Impl::prompt);
        ::el_wset(editor_, EL_GETCFN, &Impl::getCharacter);
    }

    ~Impl() {
        save();
        ::el_end(editor_);
        ::history_wend(history_);
    }

    Impl(const Impl&) = delete;
    Impl& operator=(const Impl&) = delete;

    ReadLine read(const std::string& prompt, const std::function<bool()>& done) {
        prompt_.assign(prompt.begin(), prompt.end());
        done_ = &done;
        doneSeen_ = false;
        error_ = nullptr;
        ::el_resize(editor_);
        // The library shows the prompt before it sets the terminal up; a key that is pressed in between would mean
        // something else, Ctrl-D nothing.
        ::el_wset(editor_, EL_PREP_TERM, 1);
        int count = 0;
        const wchar_t* const typed = ::el_wgets(editor_, &count);
        std::fflush(stdout);
        if (error_) {
            std::rethrow_exception(error_);
        }
        if (doneSeen_ || typed == nullptr) {
            std::fputs("\n", stdout);
            std::fflush(stdout);
            return {doneSeen_ ? ReadLine::End::Done : ReadLine::End::EndOfInput, {}};
        }
        std::string line = toUtf8(typed);
        if (!line.empty() && line.back() == '\n') {
            line.pop_back();
        }
        if (line.find_first_not_of(" \t") != std::string::npos) {
            HistEventW event{};
            ::history_w(history_, &event, H_ENTER, typed);
        }
        return {ReadLine::End::Newline, std::move(line)};
    }

  private:
    static Impl& of(EditLine* editor) {
        void* self = nullptr;
        ::el_wget(editor, EL_CLIENTDATA, &self);
        return *static_cast<Impl*>(self);
    }

    static wchar_t* prompt(EditLine* editor) { return of(editor).prompt_.data(); }

    // Exceptions must not pass through the library, so they are kept for read().
    static int getCharacter(EditLine* editor, wchar_t* character) {
        Impl& self = of(editor);
        try {
            return self.nextCharacter(*character);
        } catch (...) {
            self.error_ = std::current_exception();
            return -1;
        }
    }

    int nextCharacter(wchar_t& character) {
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
            const auto length = std::mbrtowc(&character, &byte, 1, &state);
            if (length == static_cast<std::size_t>(-1)) {
                state = {};
            } else if (length != static_cast<std::size_t>(-2)) {
                return 1;
            }
        }
    }

    void save() noexcept {
        if (historyFile_.empty()) {
            return;
        }
        std::error_code error;
        std::filesystem::create_directories(std::filesystem::path(historyFile_).parent_path(), error);
        // The library keeps the mode of a file that is there.
        const Descriptor file(::open(historyFile_.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600));
        if (file && ::fchmod(file.get(), 0600) == 0) {
            HistEventW event{};
            ::history_w(history_, &event, H_SAVE, historyFile_.c_str());
        }
    }

    Conversation& conversation_;
    const std::string historyFile_;
    HistoryW* history_ = nullptr;
    EditLine* editor_ = nullptr;
    std::wstring prompt_;
    const std::function<bool()>* done_ = nullptr;
    bool doneSeen_ = false;
    std::exception_ptr error_;
};

LineEditor::LineEditor(Conversation& conversation, std::string historyFile)
    : impl_(std::make_unique<Impl>(conversation, std::move(historyFile))) {}

LineEditor::~LineEditor() = default;

ReadLine LineEditor::read(const std::string& prompt, const std::function<bool()>& done) {
    return impl_->read(prompt, done);
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

}  // namespace client
