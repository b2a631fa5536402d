"""Random operations on a tree of files, as people and their programs make them.

The same seed makes the same operations, whatever the file system and the user.
"""

import contextlib
import ctypes
import mmap
import os
import plistlib

_LIBC = ctypes.CDLL(None, use_errno=True)
_EXCHANGE = 2
_AT_FDCWD = -100
_AT_SYMLINK_FOLLOW = 0x400

_NAMES = [b"a", b"b", b"c", b"doc.txt", b"report.txt", b"photo.jpg", b"notes.md", b"\xff\xfe", b"new\nline", b"100%41", b"two words",
          b".hidden", b"#12", b"Inbox", b"did=1", "Ünï".encode(), b"e\xcc\x81.txt", b"caf\xe9.txt"]
_PACKAGES = [b".folio", b".tonemill"]
_DEPTH_MAX = 10  # Of what operations make something in.
_LEVELS_MAX = 20  # Of what a moved tree may reach down to: paths stay shorter than a call takes.
_NAME_MAX = 120

RANK = "user.com.vemra.favorite-rank.number#PS"
TAGS = "user.com.vemra.metadata:_kMDItemUserTags"


def archive(value):
    """As the provider reads attributes."""
    return plistlib.dumps({"archiver": "KsKeyedArchiver", "version": 1, "root": value}, fmt=plistlib.FMT_BINARY)


def exchange(a, b):
    if _LIBC.renameat2(_AT_FDCWD, a, _AT_FDCWD, b, _EXCHANGE) != 0:
        raise OSError(ctypes.get_errno(), "renameat2", a)


def link_descriptor(descriptor, path):
    """Gives a name to a file that was made without one."""
    source = b"/proc/self/fd/%d" % descriptor
    if _LIBC.linkat(_AT_FDCWD, source, _AT_FDCWD, path, _AT_SYMLINK_FOLLOW) != 0:
        raise OSError(ctypes.get_errno(), "linkat", path)


class Node:
    """A name in the tree. Names of one file share a list of themselves."""

    __slots__ = ("name", "parent", "kind", "children", "names", "place")

    def __init__(self, name, parent, kind, names=None):
        self.name = name
        self.parent = parent
        self.kind = kind  # "folder", "file" or "link"
        self.children = {} if kind == "folder" else None
        self.names = [] if names is None else names
        self.names.append(self)
        self.place = None  # In the list of its kind; none for what is not in the tree.

    @property
    def is_package(self):
        return self.kind == "folder" and self.name.endswith(tuple(_PACKAGES))

    def depth(self):
        return 0 if self.parent is None else self.parent.depth() + 1

    def height(self):
        return 1 + max((child.height() for child in self.children.values()), default=0) if self.children else 0

    def and_below(self):
        yield self
        for child in self.children.values() if self.children else ():
            yield from child.and_below()

    def fits(self, folder):
        """Whether it can be moved into the folder."""
        return not folder.is_at_or_below(self) and folder.depth() + self.height() < _LEVELS_MAX

    def is_at_or_below(self, folder):
        return self is folder or (self.parent is not None and self.parent.is_at_or_below(folder))


class Tree:
    """What is below a root, and what was moved out of it to a folder beside."""

    def __init__(self, root, beside, random):
        self.root_path = os.fsencode(root)
        self.beside_path = os.fsencode(beside)
        self.random = random
        self.root = Node(b"", None, "folder")
        self.lists = {"folder": [], "file": [], "link": []}
        self.outside = []
        self.vacated = set()  # Folders and names that something was removed from: a document's next file takes it over.
        self.number = 0
        self._enter(self.root)

    # The lists, from which operations choose.

    def _enter(self, node):
        nodes = self.lists[node.kind]
        node.place = len(nodes)
        nodes.append(node)
        for child in list(node.children.values()) if node.children else ():
            self._enter(child)

    def _leave(self, node):
        nodes = self.lists[node.kind]
        last = nodes.pop()
        if last is not node:
            nodes[node.place] = last
            last.place = node.place
        node.place = None
        for child in list(node.children.values()) if node.children else ():
            self._leave(child)

    def size(self):
        return sum(len(nodes) for nodes in self.lists.values())

    def add(self, parent, name, kind, names=None):
        node = Node(name, parent, kind, names)
        parent.children[name] = node
        self._enter(node)
        return node

    def drop(self, node):
        """The name is gone, and all below it."""
        self.vacated.add((node.parent, node.name))
        self._detach(node)
        stack = [node]
        while stack:
            one = stack.pop()
            one.names.remove(one)
            stack.extend(one.children.values() if one.children else ())

    def _detach(self, node):
        self._leave(node)
        if node.parent is not None:
            del node.parent.children[node.name]
            node.parent = None

    def place(self, node, parent, name):
        """The node is at another place; what was there is gone."""
        if node.parent is parent and node.name == name:
            return
        if name in parent.children:
            self.drop(parent.children[name])
        if node.place is not None:
            self._detach(node)
        node.parent = parent
        node.name = name
        parent.children[name] = node
        self._enter(node)

    # Choices.

    def path(self, node, *more):
        names = list(reversed(more))
        while node.parent is not None:
            names.append(node.name)
            node = node.parent
        return b"/".join([self.root_path, *reversed(names)])

    def folder(self):
        return self.random.choice(self.lists["folder"])

    def shallow_folder(self):
        folder = self.folder()
        while folder.depth() >= _DEPTH_MAX:
            folder = folder.parent
        return folder

    def other_folder(self):
        """Any but the root, or none."""
        folders = self.lists["folder"]
        return self.random.choice(folders[1:]) if len(folders) > 1 else None

    def file(self):
        files = self.lists["file"]
        return self.random.choice(files) if files else None

    def any_node(self):
        kind = self.random.choices(["file", "folder", "link"], [6, 3, 1])[0]
        return self.other_folder() if kind == "folder" else self.random.choice(self.lists[kind]) if self.lists[kind] else None

    def name(self, kind="file"):
        name = self.random.choice(_NAMES)
        if self.random.random() < 0.6:
            name = b"%d %s" % (self.random.randrange(40), name)
        if kind == "folder" and self.random.random() < 0.15:
            name += self.random.choice(_PACKAGES)
        return name

    def unused(self, folder, kind="file"):
        name = self.name(kind)
        while name in folder.children:
            self.number += 1
            name = b"%d %s" % (self.number, name.split(b" ", 1)[-1])
        return name

    def contents(self):
        return self.random.randbytes(self.random.choice([0, 1, 10, 100, 5000]))

    def verify(self):
        """The file system has what the tree says: otherwise the operations are not what they are told to be."""
        found = {self.root_path}
        for folder, folders, files in os.walk(self.root_path):
            found.update(os.path.join(folder, name) for name in folders + files)
        known = {self.path(node) for nodes in self.lists.values() for node in nodes}
        assert found == known, (found - known, known - found)

    def files_with_several_names(self):
        """File IDs of files in the tree that have more than one name, wherever."""
        return {os.lstat(self.path(node)).st_ino for node in self.lists["file"] if len(node.names) > 1}


def _write(path, contents, flags=os.O_CREAT | os.O_TRUNC):
    file = os.open(path, os.O_WRONLY | flags, 0o644)
    try:
        os.write(file, contents)
    finally:
        os.close(file)


class Operations:
    """Each operation answers a line that tells what it did, or none where the tree has nothing for it."""

    def __init__(self, tree, size):
        self.tree = tree
        self.random = tree.random
        self.size = size
        # inotify tells nothing of a name that a file is given in a folder that isn't watched, or that is gone before the
        # folder's events are read; from the next look at the file on it does.
        self.names_outside_are_told = True
        self.had_several_names = set()
        # Names of files that were out of sight, gave their document to another file, or took another's.
        self.may_be_another_document = []
        self.growing = [(self.make_file, 10), (self.make_folder, 4), (self.make_tree, 1), (self.move_in, 3), (self.hard_link, 2),
                        (self.symbolic_link, 2), (self.hard_link_outside, 1)]
        self.steady = [(self.write, 6), (self.append, 6), (self.truncate, 3), (self.write_mapped, 3), (self.rename, 8),
                       (self.rename_over, 4), (self.exchange, 3), (self.move, 8), (self.safe_save, 14), (self.change_mode, 3),
                       (self.change_attribute, 3), (self.change_metadata, 3), (self.change_times, 2), (self.become_package, 3),
                       (self.trash, 2), (self.untrash, 1), (self.change_kind, 2), (self.rename_folder_over, 1), (self.come_and_go, 2),
                       (self.to_and_fro, 2), (self.change_outside_name, 2), (self.make_again, 2)]
        self.shrinking = [(self.remove_file, 8), (self.remove_tree, 1), (self.move_out, 2), (self.remove_outside, 1)]

    def run(self):
        """One operation that finds something to do."""
        while True:
            fullness = self.tree.size() / self.size
            weighed = [(operation, weight * (2 - fullness)) for operation, weight in self.growing]
            weighed += self.steady
            weighed += [(operation, weight * fullness) for operation, weight in self.shrinking]
            operations, weights = zip(*((operation, max(weight, 0.01)) for operation, weight in weighed))
            told = self.random.choices(operations, weights)[0]()
            if told is not None:
                return told

    # Making and removing.

    def make_file(self):
        folder = self.tree.shallow_folder()
        name = self.tree.unused(folder)
        node = self.tree.add(folder, name, "file")
        _write(self.tree.path(node), self.tree.contents())
        return f"create {self.tree.path(node)}"

    def make_folder(self):
        folder = self.tree.shallow_folder()
        node = self.tree.add(folder, self.tree.unused(folder, "folder"), "folder")
        os.mkdir(self.tree.path(node))
        return f"mkdir {self.tree.path(node)}"

    def make_tree(self):
        """As an unpacked archive: files into folders that were just made."""
        folder = self.tree.shallow_folder()
        top = self.tree.add(folder, self.tree.unused(folder, "folder"), "folder")
        os.mkdir(self.tree.path(top))
        made = [top]
        for _ in range(self.random.randrange(1, 12)):
            parent = self.random.choice(made)
            kind = "folder" if self.random.random() < 0.4 else "file"
            node = self.tree.add(parent, self.tree.unused(parent, kind), kind)
            if kind == "folder":
                os.mkdir(self.tree.path(node))
                made.append(node)
            else:
                _write(self.tree.path(node), self.tree.contents())
        return f"make tree {self.tree.path(top)}"

    def _remove(self, path):
        if not os.path.isdir(path) or os.path.islink(path):
            os.unlink(path)
            return
        for entry in sorted(os.listdir(path)):
            self._remove(os.path.join(path, entry))
        os.rmdir(path)

    def remove_file(self):
        node = self.tree.file() if self.random.random() < 0.8 else self._link()
        if node is None:
            return None
        path = self.tree.path(node)
        os.unlink(path)
        self.tree.drop(node)
        return f"unlink {path}"

    def _link(self):
        return self.random.choice(self.tree.lists["link"]) if self.tree.lists["link"] else None

    def remove_tree(self):
        node = self.tree.other_folder()
        if node is None:
            return None
        path = self.tree.path(node)
        self._remove(path)
        self.tree.drop(node)
        return f"remove tree {path}"

    def make_again(self):
        """Removed and made again at once: the file system gives the number to the new one."""
        node = self.tree.any_node()
        if node is None or node.kind == "link":
            return None
        parent, name, kind, path = node.parent, node.name, node.kind, self.tree.path(node)
        self._remove(path)
        self.tree.drop(node)
        self.tree.add(parent, name, kind)
        if kind == "folder":
            os.mkdir(path)
        else:
            _write(path, self.tree.contents())
        return f"remove and make again {path}"

    def change_kind(self):
        """A file in the place of a folder, a folder in the place of a file."""
        node = self.tree.any_node()
        if node is None:
            return None
        parent, name, path = node.parent, node.name, self.tree.path(node)
        kind = self.random.choice([kind for kind in ("file", "folder", "link") if kind != node.kind])
        self._remove(path)
        self.tree.drop(node)
        self.tree.add(parent, name, kind)
        if kind == "folder":
            os.mkdir(path)
        elif kind == "file":
            _write(path, self.tree.contents())
        else:
            os.symlink(b"nowhere", path)
        return f"{path} becomes a {kind}"

    def come_and_go(self):
        """A temporary file, or folder, that nobody may ever hear of."""
        folder = self.tree.folder()
        path = self.tree.path(folder, self.tree.unused(folder))
        if self.random.random() < 0.3:
            os.mkdir(path)
            _write(path + b"/inside", b"x")
            self._remove(path)
        else:
            _write(path, b"x")
            os.unlink(path)
        return f"come and go {path}"

    # Contents and attributes.

    def _changed(self, change):
        node = self.tree.file()
        if node is None:
            return None
        path = self.tree.path(node)
        os.chmod(path, 0o644)
        change(path)
        return path

    def write(self):
        path = self._changed(lambda path: _write(path, self.tree.contents()))
        return path and f"write {path}"

    def append(self):
        path = self._changed(lambda path: _write(path, b"more", os.O_APPEND))
        return path and f"append {path}"

    def truncate(self):
        path = self._changed(lambda path: os.truncate(path, self.random.choice([0, 1, 50, 7000])))
        return path and f"truncate {path}"

    def write_mapped(self):
        def change(path):
            with open(path, "r+b") as file:
                file.truncate(100)
                with mmap.mmap(file.fileno(), 100) as memory:
                    memory[0:4] = self.random.randbytes(4)
        path = self._changed(change)
        return path and f"mmap write {path}"

    def change_mode(self):
        node = self.tree.file() if self.random.random() < 0.7 else self.tree.other_folder()
        if node is None:
            return None
        mode = self.random.choice([0o644, 0o600, 0o444] if node.kind == "file" else [0o755, 0o700, 0o750])
        os.chmod(self.tree.path(node), mode)
        return f"chmod {mode:o} {self.tree.path(node)}"

    def _attribute(self, name, value):
        node = self.tree.any_node()
        if node is None or node.kind == "link":
            return None
        path = self.tree.path(node)
        os.chmod(path, 0o755 if node.kind == "folder" else 0o644)
        if value is not None:
            os.setxattr(path, name, value)
        else:
            with contextlib.suppress(OSError):
                os.removexattr(path, name)
        return path

    def change_attribute(self):
        path = self._attribute("user.colour", self.random.choice([b"red", b"green", None]))
        return path and f"attribute {path}"

    def change_metadata(self):
        if self.random.random() < 0.5:
            path = self._attribute(RANK, self.random.choice([archive(self.random.randrange(10)), None]))
        else:
            path = self._attribute(TAGS, self.random.choice([archive([self.random.choice("xyz")]), None]))
        return path and f"metadata {path}"

    def change_times(self):
        node = self.tree.any_node()
        if node is None:
            return None
        time = self.random.randrange(10**18)
        os.utime(self.tree.path(node), ns=(time, time), follow_symlinks=False)
        return f"utime {self.tree.path(node)}"

    # Names and places.

    def _move(self, node, parent, name):
        source, target = self.tree.path(node), self.tree.path(parent, name)
        os.rename(source, target)
        self.tree.place(node, parent, name)
        return f"rename {source} -> {target}"

    def rename(self):
        node = self.tree.any_node()
        return node and self._move(node, node.parent, self.tree.unused(node.parent, node.kind))

    def move(self):
        node, folder = self.tree.any_node(), self.tree.shallow_folder()
        if node is None or not node.fits(folder):
            return None
        keeps_name = node.name not in folder.children and self.random.random() < 0.7
        return self._move(node, folder, node.name if keeps_name else self.tree.unused(folder, node.kind))

    def rename_over(self):
        node, other = self.tree.file(), self.tree.file()
        # Two names of one file: the call does nothing.
        if node is None or node.names is other.names:
            return None
        self.may_be_another_document.append(node.names)
        return self._move(node, other.parent, other.name)

    def rename_folder_over(self):
        node, other = self.tree.other_folder(), self.tree.other_folder()
        if node is None or other.children or not node.fits(other):
            return None
        return self._move(node, other.parent, other.name)

    def exchange(self):
        a, b = self.tree.any_node(), self.tree.any_node()
        if a is None or b is None or a.names is b.names:
            return None
        if a.is_at_or_below(b) or b.is_at_or_below(a) or not a.fits(b.parent) or not b.fits(a.parent):
            return None
        path_of_a, path_of_b = self.tree.path(a), self.tree.path(b)
        exchange(path_of_a, path_of_b)
        parent_of_a, name_of_a, parent_of_b, name_of_b = a.parent, a.name, b.parent, b.name
        for node in (a, b):
            self.tree._detach(node)
        self.tree.place(a, parent_of_b, name_of_b)
        self.tree.place(b, parent_of_a, name_of_a)
        return f"exchange {path_of_a} {path_of_b}"

    def to_and_fro(self):
        """The kernel folds these into something ambiguous."""
        node = self.tree.file()
        if node is None:
            return None
        parent, before, other = node.parent, node.name, self.tree.unused(node.parent)
        told = [self._move(node, parent, other), self._move(node, parent, before)]
        if self.random.random() < 0.5:
            told.append(self._move(node, parent, other))
        return "; ".join(told)

    def become_package(self):
        node = self.tree.other_folder()
        if node is None:
            return None
        if node.is_package:
            name = node.name.rsplit(b".", 1)[0] or b"plain"
        else:
            name = node.name + self.random.choice(_PACKAGES)
        if name in node.parent.children or len(name) > _NAME_MAX:
            return None
        return self._move(node, node.parent, name)

    def trash(self):
        node = self.tree.any_node()
        home = self.tree.root if self.random.random() < 0.7 else self.tree.shallow_folder()
        if node is None or home.is_at_or_below(node) or node.name == b".Trash":
            return None
        trash = home.children.get(b".Trash")
        if trash is None:
            trash = self.tree.add(home, b".Trash", "folder")
            os.mkdir(self.tree.path(trash))
        if trash.kind != "folder" or not node.fits(trash):
            return None
        return self._move(node, trash, self.tree.unused(trash, node.kind))

    def untrash(self):
        trash = self.tree.root.children.get(b".Trash")
        if trash is None or not trash.children:
            return None
        node = self.random.choice(list(trash.children.values()))
        folder = self.tree.shallow_folder()
        if not node.fits(folder):
            return None
        return self._move(node, folder, self.tree.unused(folder, node.kind))

    # The folder beside.

    def move_out(self):
        node = self.tree.any_node()
        if node is None:
            return None
        self.tree.number += 1
        outside = os.path.join(self.tree.beside_path, b"%d" % self.tree.number)
        path = self.tree.path(node)
        os.rename(path, outside)
        self.tree.vacated.add((node.parent, node.name))
        self.tree._detach(node)
        self.tree.outside.append((outside, node))
        self.may_be_another_document.extend(one.names for one in node.and_below() if one.kind == "file")
        return f"move out {path} -> {outside}"

    def move_in(self):
        if not self.tree.outside:
            return None
        outside, node = self.tree.outside.pop(self.random.randrange(len(self.tree.outside)))
        folder = self.tree.shallow_folder()
        if not node.fits(folder):
            folder = self.tree.root
        name = self.tree.unused(folder, node.kind)
        os.rename(outside, self.tree.path(folder, name))
        self.tree.place(node, folder, name)
        return f"move in {outside} -> {self.tree.path(node)}"

    def remove_outside(self):
        if not self.tree.outside:
            return None
        outside, node = self.tree.outside.pop(self.random.randrange(len(self.tree.outside)))
        self._remove(outside)
        stack = [node]
        while stack:
            one = stack.pop()
            one.names.remove(one)
            stack.extend(one.children.values() if one.children else ())
        return f"remove {outside}"

    # Links.

    def hard_link(self):
        node, folder = self.tree.file(), self.tree.shallow_folder()
        if node is None:
            return None
        source = self.tree.path(node)
        other = self.tree.add(folder, self.tree.unused(folder), "file", node.names)
        os.link(source, self.tree.path(other))
        self.had_several_names.add(os.lstat(source).st_ino)
        return f"link {source} {self.tree.path(other)}"

    def hard_link_outside(self):
        node = self.tree.file()
        if node is None:
            return None
        self.tree.number += 1
        outside = os.path.join(self.tree.beside_path, b"%d" % self.tree.number)
        os.link(self.tree.path(node), outside)
        self.tree.outside.append((outside, Node(b"", None, "file", node.names)))
        self.may_be_another_document.append(node.names)
        if not self.names_outside_are_told:
            os.chmod(self.tree.path(node), 0o644)
        return f"link {self.tree.path(node)} {outside}"

    def change_outside_name(self):
        """A file of the tree, changed under a name that nobody watches."""
        names = [outside for outside, node in self.tree.outside if len(node.names) > 1]
        if not names:
            return None
        path = self.random.choice(names)
        os.chmod(path, 0o644)
        _write(path, b"outside", os.O_APPEND)
        return f"append {path}"

    def symbolic_link(self):
        folder = self.tree.shallow_folder()
        node = self.tree.add(folder, self.tree.unused(folder), "link")
        os.symlink(self.random.choice([b".", b"..", b"nowhere", b"/", b"a"]), self.tree.path(node))
        return f"symlink {self.tree.path(node)}"

    # Saving.

    def safe_save(self):
        node = self.tree.file()
        if node is None or len(node.name) > _NAME_MAX:
            return None
        ways = [self._save_in_place, self._save_with_copy, self._save_with_backup, self._save_keeping_backup, self._save_by_rename,
                self._save_by_rename_keeping_link, self._save_by_rename_and_mode, self._save_without_a_name,
                self._save_keeping_original, self._save_by_removal]
        way = self.random.choice(ways)
        path = self.tree.path(node)
        # A name beside it that a folder has is in the way of some.
        beside = [node.name + affix for affix in (b"~", b".bak", b".tmp")]
        if any(name in node.parent.children and node.parent.children[name].kind != "file" for name in beside):
            return None
        os.chmod(path, 0o644)
        way(node, path)
        return f"{way.__name__[1:].replace('_', ' ')} {path}"

    def _replaced(self, node):
        """The name now has a file of its own."""
        parent, name = node.parent, node.name
        self.tree.drop(node)
        return self.tree.add(parent, name, "file")

    def _backup(self, node, affix):
        """The file is under the backup's name, whatever was there before; its own name is free."""
        parent, name = node.parent, node.name
        self.may_be_another_document.append(node.names)
        os.rename(self.tree.path(node), self.tree.path(parent, name + affix))
        self.tree.place(node, parent, name + affix)
        return parent, name

    def _save_in_place(self, node, path):
        _write(path, self.tree.contents(), os.O_TRUNC)

    def _save_with_copy(self, node, path):
        backup = path + b"~"
        existed = os.path.lexists(backup)
        if existed:
            os.chmod(backup, 0o644)
        _write(backup, b"copy")
        _write(path, self.tree.contents(), os.O_TRUNC)
        if not existed:
            os.unlink(backup)

    def _save_with_backup(self, node, path):
        probe = os.path.join(os.path.dirname(path), b"4913")
        _write(probe, b"")
        os.unlink(probe)
        parent, name = self._backup(node, b"~")
        self.tree.add(parent, name, "file")
        _write(path, self.tree.contents())
        os.unlink(self.tree.path(node))
        self.tree.drop(node)

    def _save_keeping_backup(self, node, path):
        lock = os.path.join(os.path.dirname(path), b".#" + node.name)
        if os.path.lexists(lock):
            lock += b" of another"
        os.symlink(b"somebody", lock)
        backup = node.parent.children.get(node.name + b"~")
        if backup is not None and backup.names is node.names:
            os.unlink(lock)
            return
        parent, name = self._backup(node, b"~")
        self.tree.add(parent, name, "file")
        _write(path, self.tree.contents())
        os.chmod(path, 0o644)
        os.unlink(lock)

    def _temporary(self, path, name):
        temporary = os.path.join(os.path.dirname(path), name)
        _write(temporary, self.tree.contents(), os.O_CREAT | os.O_EXCL)
        return temporary

    def _save_by_rename(self, node, path):
        name = self.random.choice([b".goutputstream-%06x", b"sed%06x", b".doc.%06x"]) % self.random.randrange(1 << 24)
        os.rename(self._temporary(path, name), path)
        self._replaced(node)

    def _save_by_rename_keeping_link(self, node, path):
        if node.name + b"~" in node.parent.children:
            return
        os.link(path, path + b"~")
        self.may_be_another_document.append(node.names)
        self.tree.add(node.parent, node.name + b"~", "file", node.names)
        self._save_by_rename(node, path)

    def _save_by_rename_and_mode(self, node, path):
        lock = self._temporary(path, b".~lock.%06x#" % self.random.randrange(1 << 24))
        os.rename(self._temporary(path, b"lu%06x.tmp" % self.random.randrange(1 << 24)), path)
        self._replaced(node)
        os.chmod(path, 0o600)
        os.unlink(lock)

    def _save_without_a_name(self, node, path):
        file = os.open(os.path.dirname(path), os.O_TMPFILE | os.O_RDWR, 0o644)
        try:
            os.write(file, self.tree.contents())
            temporary = path + b".%06x" % self.random.randrange(1 << 24)
            link_descriptor(file, temporary)
            os.rename(temporary, path)
            if self.random.random() < 0.3:
                os.write(file, b"and a little later")
        finally:
            os.close(file)
        self._replaced(node)

    def _save_keeping_original(self, node, path):
        backup = node.parent.children.get(node.name + b".bak")
        if backup is not None and backup.names is node.names:
            return
        temporary = self._temporary(path, b"sed%06x" % self.random.randrange(1 << 24))
        parent, name = self._backup(node, b".bak")
        os.rename(temporary, path)
        self.tree.add(parent, name, "file")

    def _save_by_removal(self, node, path):
        os.unlink(path)
        self._replaced(node)
        _write(path, self.tree.contents())
