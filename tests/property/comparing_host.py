"""Hosts that need no event history: they list anew at each request for changes and compare.

What a client is told by them is right by construction, so that they show whether the operations, the views and the
comparison are. With a fault, they show that the comparison finds it.
"""

import os
import stat

from cindral_rpc import ROOT, RpcError
from container_view import ALL_DIRECTORIES, listed

_BATCH = 100


class WalkedListing:
    """Lists a storage with the system's own means; files are named by their numbers."""

    def __init__(self, storage):
        self.storage = os.fsencode(storage)

    def call(self, method, container):
        assert method == "enumerateItems"
        items = list(self._walk(self.storage, container, ROOT))
        if container.startswith("fid=") and not self._exists(container):
            raise RpcError({"code": -32000, "message": "no such item", "data": {"domain": "TesselErrorDomain", "code": -1001}})
        return {"items": items, "nextPage": None}

    def _exists(self, container):
        return any(self._identifier(os.lstat(folder)) == container for folder, _, _ in os.walk(self.storage))

    @staticmethod
    def _identifier(status):
        return f"fid={status.st_ino}"

    def _walk(self, folder, container, identifier):
        recursive = container not in (ROOT,) and not container.startswith("fid=")
        for entry in sorted(os.listdir(folder)):
            path = os.path.join(folder, entry)
            status = os.lstat(path)
            is_folder = stat.S_ISDIR(status.st_mode)
            own = self._identifier(status)
            if (recursive or container == identifier) and entry != b".Trash" and (is_folder or container != ALL_DIRECTORIES):
                yield {"identifier": own, "parentIdentifier": identifier, "filename": entry.decode("utf-8", "replace"),
                       "typeIdentifier": str(stat.S_IFMT(status.st_mode)), "documentSize": status.st_size, "fileID": status.st_ino,
                       "versionIdentifier": f"{status.st_mtime_ns} {status.st_ctime_ns}",
                       "isTrashed": b"/.Trash/" in path, "fileURL": repr(path)}
            if is_folder:
                yield from self._walk(path, container, own)


class ComparingHost:
    """Answers requests for changes by comparing two listings of another."""

    def __init__(self, listing, loses_every=0):
        self.listing = listing
        self.loses_every = loses_every
        self.said = 0
        self.anchors = {}

    def call(self, method, **params):
        if method == "currentSyncAnchor":
            return {"anchor": self._anchor(listed(self.listing, params["container"])[0])}
        if method == "enumerateChanges":
            return self._changes(**params)
        return self.listing.call(method, **params)

    def _anchor(self, items):
        name = str(len(self.anchors))
        self.anchors[name] = items
        return name

    def _changes(self, container, anchor):
        before = dict(self.anchors[anchor])
        now, _ = listed(self.listing, container)
        deleted = [identifier for identifier in before if identifier not in now]
        updated = [item for identifier, item in now.items() if before.get(identifier) != item]
        # What is below a deleted folder goes with it; what is still there is told anew.
        told = set(item["identifier"] for item in updated)
        parents = set(deleted)
        updated += [item for item in now.values() if item["identifier"] not in told
                    and before.get(item["identifier"], item)["parentIdentifier"] in parents]
        log = [("d", identifier) for identifier in deleted] + [("u", item["identifier"]) for item in updated]
        more = len(log) > _BATCH
        log = log[:_BATCH]
        updated = [item for item in updated if ("u", item["identifier"]) in log]
        for what, identifier in log:
            if what == "d":
                del before[identifier]
            else:
                before[identifier] = now[identifier]
        anchor = self._anchor(before)
        log = [change for change in log if not self._is_lost()]
        updated = [item for item in updated if ("u", item["identifier"]) in log]
        return {"updated": updated, "deleted": [identifier for what, identifier in log if what == "d"], "log": log,
                "anchor": anchor, "moreComing": more}

    def _is_lost(self):
        self.said += 1
        return self.loses_every > 0 and self.said % self.loses_every == 0
