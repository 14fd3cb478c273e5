"""Functions of libosutils through ctypes. What the library allocates is copied and freed here.

The loader finds libosutils.so.6 in its own folders or in LD_LIBRARY_PATH. Text is str, in the encoding of file names; a
result that the library does not have is None."""
import ctypes
import os

# The result codes that these functions return.
SUCCESS = 0
CONSTRAINT_VIOLATION = 19
NO_SUCH_OBJECT = 32
INSUFFICIENT_ACCESS = 50
PARAM_ERROR = 89

_library = ctypes.CDLL("libosutils.so.6")
_free = ctypes.CDLL(None).free
_free.argtypes = [ctypes.c_void_p]
_free.restype = None


def _function(name, result, *arguments):
    function = getattr(_library, name)
    function.restype = result
    function.argtypes = arguments
    return function


# The results to free are addresses: ctypes would copy a c_char_p and lose the address.
_getUserHomeDir = _function("getUserHomeDir", ctypes.c_void_p, ctypes.c_char_p)
_getUsersPrimaryGroup = _function("getUsersPrimaryGroup", ctypes.c_void_p, ctypes.c_char_p)
_vra_getgrnam_mem = _function("vra_getgrnam_mem", ctypes.c_void_p, ctypes.c_char_p)
_formatDn = _function("formatDn", ctypes.c_void_p, ctypes.c_char_p)
_compareDns = _function("compareDns", ctypes.c_bool, ctypes.c_char_p, ctypes.c_char_p)
_checkFilePerms = _function("checkFilePerms", ctypes.c_int, ctypes.c_char_p)


def _bytes(text):
    encoded = os.fsencode(text)
    if b"\0" in encoded:
        raise ValueError("a null character in the text")
    return encoded


def _taken(address):
    """The text at the address, which is freed; None for null."""
    if address is None:
        return None
    try:
        return os.fsdecode(ctypes.string_at(address))
    finally:
        _free(address)


def _taken_list(address):
    """The texts of the list at the address, which is freed with its entries; None for null."""
    if address is None:
        return None
    entries = ctypes.cast(address, ctypes.POINTER(ctypes.c_void_p))
    texts = []
    try:
        while (entry := entries[len(texts)]) is not None:
            texts.append(_taken(entry))
        return texts
    finally:
        _free(address)


def user_home(user):
    """The user's home directory, or None."""
    return _taken(_getUserHomeDir(_bytes(user)))


def primary_group(user=None):
    """The name of the primary group of the user, or of the process's real user; None if it has none."""
    return _taken(_getUsersPrimaryGroup(None if user is None else _bytes(user)))


def group_members(group):
    """The members that the group's entry names, or None for an unknown group."""
    return _taken_list(_vra_getgrnam_mem(_bytes(group)))


def format_dn(name):
    """The distinguished name in its canonical spelling, or None for an empty one."""
    return _taken(_formatDn(_bytes(name)))


def equal_dns(one, other):
    """Whether both distinguished names have the same canonical spelling."""
    return _compareDns(_bytes(one), _bytes(other))


def check_file(path):
    """SUCCESS, or the result code that says why the path is not a file that can be examined."""
    return _checkFilePerms(_bytes(path))
