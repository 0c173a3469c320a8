// Pictures that requests have shown, in front of a person or a program.
#pragma once

#include <functional>
#include <optional>
#include <string>

#include "krutil/base/Output.hpp"
#include "krutil/display/Pictures.hpp"
#include "krutil/display/Printer.hpp"
#include "krutil/session/Client.hpp"
#include "krutil/terminal/TerminalImages.hpp"

namespace krutil_client {

/// Asks the engine for the pictures that a request has announced, when that has ended. A terminal that can draw them
/// does; it is asked about that when there is the first one. Otherwise they are written to files, which the printer
/// names. Main thread only.
class PictureViewer {
  public:
    enum class Way {
        AllToFiles,  ///< every form
        BestToFile,  ///< the best image of each picture
        Drawn,       ///< the same, drawn if the terminal can; standard input must be that terminal
    };

    /// What a person types while the terminal is asked goes to `typed`. All must outlive the object, and the object all
    /// requests of the client.
    PictureViewer(Client& client, Printer& printer, Output& out, Way way,
                  std::function<void(const std::string& text)> typed);
    ~PictureViewer();
    PictureViewer(const PictureViewer&) = delete;
    PictureViewer& operator=(const PictureViewer&) = delete;

  private:
    void showAll();
    void show(const Picture& picture);
    bool draw(const PictureForm& form);

    Client& client_;
    Printer& printer_;
    Output& out_;
    const Way way_;
    const std::function<void(const std::string& text)> typed_;
    std::optional<ImageProtocol> protocol_;  ///< empty before the terminal has been asked
};

}  // namespace krutil_client
