"""Failures of a run."""


class LabError(Exception):
    """The lab itself failed."""


class CheckFailed(Exception):
    """A check failed."""

    def __init__(self, what: str, expected: str, seen: str):
        super().__init__(what)
        self.what = what
        self.expected = expected
        self.seen = seen
