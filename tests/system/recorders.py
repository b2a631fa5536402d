"""Which recorders whoever runs the tests may use."""

import ctypes
import os
import tempfile

_LIBC = ctypes.CDLL(None, use_errno=True)
_FAN_NONBLOCK_WITH_NAMES = 0x2 | 0x10 | 0x20 | 0x200 | 0x400 | 0x800
_FAN_MARK_ADD_FILE_SYSTEM = 0x1 | 0x100
_FAN_CREATE = 0x100
_AT_FDCWD = -100


def may_use_fanotify(folder=None):
    """Whether a file system can be watched whole: by the privileged only, and not on every file system."""
    folder = folder or tempfile.gettempdir()
    group = _LIBC.fanotify_init(ctypes.c_uint(_FAN_NONBLOCK_WITH_NAMES), ctypes.c_uint(0))
    if group < 0:
        return False
    try:
        return _LIBC.fanotify_mark(group, ctypes.c_uint(_FAN_MARK_ADD_FILE_SYSTEM), ctypes.c_uint64(_FAN_CREATE), _AT_FDCWD,
                                   os.fsencode(folder)) == 0
    finally:
        os.close(group)
