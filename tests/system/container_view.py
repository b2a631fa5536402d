"""A client's view of a container: listed once, from then on kept up to date with changes."""

from cindral_rpc import RpcError

ALL_DIRECTORIES = "TesselAllDirectoriesContainerItemIdentifier"

EXPIRED = ("TesselErrorDomain", -1002)
# A change that is always followed by another: an enumeration of changes comes to its end.
CALLS_MAX = 100_000


def is_expired(error):
    return (error.domain, error.domain_code) == EXPIRED


def listed(host, container):
    """A fresh listing by identifier, and how often it had to begin again because an entry came or went."""
    for restarts in range(100):
        try:
            return {item["identifier"]: item for item in _all_items(host, container)}, restarts
        except RpcError as error:
            if not is_expired(error):
                raise
    raise AssertionError(f"{container}: no listing came to its end")


def _all_items(host, container):
    params = {}
    while True:
        page = host.call("enumerateItems", container=container, **params)
        yield from page["items"]
        if page["nextPage"] is None:
            return
        params = {"page": page["nextPage"]}


class Changes:
    """What one or more enumerations of changes said."""

    def __init__(self):
        self.log = []
        self.updated = []
        self.calls = 0

    @property
    def deleted(self):
        return [identifier for what, identifier in self.log if what == "d"]

    @property
    def updated_identifiers(self):
        return [item["identifier"] for item in self.updated]


class ContainerView:
    """The items of a container, as a client knows them."""

    def __init__(self, host, container):
        """Takes the anchor, then lists: what happens in between comes as a change."""
        self.host = host
        self.container = container
        self.anchor = host.call("currentSyncAnchor", container=container)["anchor"]
        self.items, self.restarts = listed(host, container)

    def catch_up(self, calls_max=CALLS_MAX):
        """Applies changes until there are no more, or for so many calls."""
        changes = Changes()
        while changes.calls < calls_max:
            answer = self.host.call("enumerateChanges", container=self.container, anchor=self.anchor)
            changes.calls += 1
            self._apply(answer, changes)
            self.anchor = answer["anchor"]
            if not answer["moreComing"]:
                return changes
        assert calls_max < CALLS_MAX, f"{self.container}: changes without an end"
        return changes

    def _apply(self, answer, changes):
        updated = iter(answer["updated"])
        for what, identifier in answer["log"]:
            changes.log.append((what, identifier))
            if what == "u":
                item = next(updated)
                assert item["identifier"] == identifier, f"log and items differ: {identifier}, {item}"
                changes.updated.append(item)
                self.items[identifier] = item
            else:
                assert what == "d", f"neither update nor deletion: {what}"
                self._remove(identifier)
        assert next(updated, None) is None, "more items than the log says"
        assert [i for w, i in answer["log"] if w == "d"] == answer["deleted"], "log and deletions differ"

    def _remove(self, identifier):
        """Also everything below it, though the view may never have held it itself."""
        below = {}
        for item in self.items.values():
            below.setdefault(item["parentIdentifier"], []).append(item["identifier"])
        gone = [identifier]
        while gone:
            one = gone.pop()
            self.items.pop(one, None)
            gone.extend(below.pop(one, ()))

    def differences(self, fresh, is_one_of_several_names=lambda item: False, had_several_names=lambda item: False):
        """Lines that tell in what the view is not the fresh listing.

        `fileURL` of an item below a moved folder is as of when the item was last sent. An object with several names is
        listed under one of them, whichever; in a folder it may be listed under one that lies elsewhere. Where it isn't told
        that an object was given a name, was written under it and lost it again, what that changes is left out as well.
        """
        lines = []
        for identifier in sorted(self.items.keys() | fresh.keys()):
            mine, theirs = self.items.get(identifier), fresh.get(identifier)
            several = is_one_of_several_names(mine or theirs)
            if mine is None or theirs is None:
                if several and self.container.startswith(("fid=", "did=", "Tessel")) and not self._is_recursive():
                    continue
                lines.append(f"{'missing' if mine is None else 'too many'}: {mine or theirs}")
                continue
            left_out = {"fileURL"} | ({"filename", "parentIdentifier", "typeIdentifier", "isTrashed"} if several else set())
            if had_several_names(theirs):
                left_out |= {"versionIdentifier", "documentSize", "contentModificationDate", "typeIdentifier"}
            keys = sorted(key for key in (mine.keys() | theirs.keys()) - left_out if mine.get(key) != theirs.get(key))
            if keys:
                told = ", ".join(f"{key} is {mine.get(key)!r}, should be {theirs.get(key)!r}" for key in keys)
                lines.append(f"differs: {identifier} ({theirs['filename']!r}): {told}")
        return lines

    def _is_recursive(self):
        return self.container in ("TesselWorkingSetContainerItemIdentifier", ALL_DIRECTORIES)
