"""matplotlib's backend "module://qvm_pictures": figures become PNG pictures that the client shows."""

import io as _io

from matplotlib._pylab_helpers import Gcf as _Gcf
from matplotlib.backend_bases import FigureManagerBase as _FigureManagerBase
from matplotlib.backends.backend_agg import FigureCanvasAgg as _FigureCanvasAgg

import qvm_displays as _displays
from qvm import _at_end


class FigureManager(_FigureManagerBase):
    """Of a figure that pyplot knows."""

    def show(self):
        """What Figure.show() does."""
        _show([self])


class FigureCanvas(_FigureCanvasAgg):
    """Draws in memory."""

    manager_class = FigureManager


def _ours():
    """The open figures; those of a backend that was chosen before are none of ours."""
    return [each for each in _Gcf.get_all_fig_managers() if isinstance(each, FigureManager)]


def offer(figure):
    """Shows a figure as it is now, and leaves it open. Returns False where it cannot be shown."""
    return _displays.can_show() and _displays.keep([("image/png", _drawn(figure))])


def _drawn(figure):
    file = _io.BytesIO()
    figure.savefig(file, format="png")
    return file.getvalue()


def _show(managers):
    if not _displays.can_show():
        _displays.warn_cannot_show()
        return
    for each in managers:
        try:
            picture = _drawn(each.canvas.figure)
        finally:
            # Shown once, also when it cannot be drawn.
            _Gcf.destroy(each)
        _displays.keep([("image/png", picture)])


def show(*, block=None):
    """Shows all open figures, and closes them, as notebooks do. There is nothing to wait for, so block does nothing."""
    if managers := _ours():
        _show(managers)


def _show_left():
    """At the end of a request: shows what it has left open."""
    for each in _ours() if _displays.can_show() else ():
        try:
            _show([each])
        except Exception as error:
            _displays.warn_about(f"A figure that was left open cannot be shown: {type(error).__qualname__}: {error}")


_at_end.append(_show_left)
