"""Two running nodes: what emulated machines and containers share."""

from node import COMMAND_LIMIT, STATUS, Node, parse_status


class NodePair:
    """A context manager. A subclass starts `nodes` in _start() and removes everything in _end()."""

    def __init__(self):
        self.nodes: list[Node] = []

    def __enter__(self):
        try:
            self._start()
        except BaseException:
            self._end()
            raise
        return self

    def __exit__(self, *_):
        self._end()

    @property
    def a(self) -> Node:
        return self.nodes[0]

    @property
    def b(self) -> Node:
        return self.nodes[1]

    def run(self, script: str, limit: float = COMMAND_LIMIT) -> list[str]:
        """Run the script on both nodes at the same time and return its output on each."""
        started = [(node, node.channel.start(script)) for node in self.nodes]
        return [node.result(script, script_id, limit) for node, script_id in started]

    def statuses(self) -> list[dict]:
        return [parse_status(output) for output in self.run(STATUS)]

    def _start(self):
        raise NotImplementedError

    def _end(self):
        raise NotImplementedError
