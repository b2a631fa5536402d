"""Installs applications: as desktop entries, and as Flatpak 1.14 lays them out."""

import os
import shutil
import uuid

DOCUMENT_BROWSER = {"X-Cindral-SupportsDocumentBrowser": "true"}


def key_file(**groups):
    """Text of a key file; an underscore in a group's name stands for a blank."""
    lines = []
    for group, keys in groups.items():
        lines.append(f"[{group.replace('_', ' ')}]")
        lines += [f"{key}={value}" for key, value in keys.items()]
    return "\n".join(lines) + "\n"


def replace_file(path, text):
    """As installers do: whole or not at all."""
    os.makedirs(os.path.dirname(path), exist_ok=True)
    temporary = os.path.join(os.path.dirname(path), ".new-" + os.path.basename(path))
    with open(temporary, "w", encoding="utf-8") as file:
        file.write(text)
    os.rename(temporary, path)


def replace_link(path, target):
    temporary = f"{path}.{uuid.uuid4().hex}"
    os.symlink(target, temporary)
    os.rename(temporary, path)


class Entries:
    """A folder of desktop entries."""

    def __init__(self, folder):
        self.folder = folder
        os.makedirs(folder, exist_ok=True)

    def path(self, identifier):
        return os.path.join(self.folder, identifier + ".desktop")

    def install(self, identifier, container, name=None, keys=DOCUMENT_BROWSER, **more):
        entry = {"Type": "Application", "Name": name or f"The {identifier}", "X-Cindral-DataContainer": container, **keys, **more}
        replace_file(self.path(identifier), key_file(Desktop_Entry=entry))

    def uninstall(self, identifier):
        os.unlink(self.path(identifier))


class FlatpakTree:
    """An installation: `app/ID/current/active` leads to what is deployed, by two links that are swapped."""

    ARCHITECTURE, BRANCH = "x86_64", "stable"

    def __init__(self, folder):
        self.folder = folder
        os.makedirs(os.path.join(folder, "app"), exist_ok=True)
        os.makedirs(os.path.join(folder, "exports", "share"), exist_ok=True)

    def branch(self, identifier):
        return os.path.join(self.folder, "app", identifier, self.ARCHITECTURE, self.BRANCH)

    def deploy(self, identifier, name=None, keys=DOCUMENT_BROWSER, icons=None, metadata_keys=None):
        """Installs or updates. The keys stand in the exported entry, or in the metadata."""
        commit = uuid.uuid4().hex * 2
        branch = self.branch(identifier)
        os.makedirs(branch, exist_ok=True)
        # Made whole under another name first.
        new = os.path.join(branch, f".{commit}-new")
        share = os.path.join(new, "export", "share")
        os.makedirs(os.path.join(new, "files"))
        with open(os.path.join(new, "deploy"), "wb") as file:
            file.write(b"\x00binary\xff")
        replace_file(os.path.join(new, "metadata"), key_file(
            Application={"name": identifier, "runtime": "org.example.Platform/x86_64/1", **(metadata_keys or {})},
            Context={"shared": "ipc;"}))
        entry = {"Type": "Application", "Name": name or f"The {identifier}", "Icon": identifier, "Exec": "flatpak run", **keys}
        replace_file(os.path.join(share, "applications", identifier + ".desktop"), key_file(Desktop_Entry=entry))
        for path, data in (icons or {}).items():
            path = os.path.join(share, "icons", "hicolor", path)
            os.makedirs(os.path.dirname(path), exist_ok=True)
            with open(path, "wb") as file:
                file.write(data)
        os.rename(new, os.path.join(branch, commit))
        active = os.path.join(branch, "active")
        before = os.readlink(active) if os.path.islink(active) else None
        replace_link(active, commit)
        replace_link(os.path.join(self.folder, "app", identifier, "current"), f"{self.ARCHITECTURE}/{self.BRANCH}")
        self._export(identifier)
        if before:
            shutil.rmtree(os.path.join(branch, before))

    def _export(self, identifier):
        link = os.path.join(self.folder, "exports", "share", "applications", identifier + ".desktop")
        os.makedirs(os.path.dirname(link), exist_ok=True)
        replace_link(link, f"../../../app/{identifier}/current/active/export/share/applications/{identifier}.desktop")

    def remove(self, identifier):
        branch = self.branch(identifier)
        commit = os.readlink(os.path.join(branch, "active"))
        os.unlink(os.path.join(branch, "active"))
        removed = os.path.join(self.folder, ".removed")
        os.makedirs(removed, exist_ok=True)
        os.rename(os.path.join(branch, commit), os.path.join(removed, f"{identifier}-{commit}"))
        os.unlink(os.path.join(self.folder, "app", identifier, "current"))
        os.unlink(os.path.join(self.folder, "exports", "share", "applications", identifier + ".desktop"))
        shutil.rmtree(os.path.join(self.folder, "app", identifier))
        shutil.rmtree(removed)
