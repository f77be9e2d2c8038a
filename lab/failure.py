"""The ways in which a run may fail."""


class LabError(Exception):
    """The lab itself cannot go on: its message says why."""


class CheckFailed(Exception):
    """Something did not happen as it should have."""

    def __init__(self, what: str, expected: str, seen: str):
        super().__init__(what)
        self.what = what
        self.expected = expected
        self.seen = seen
