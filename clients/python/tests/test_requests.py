"""Every request against a real vantreld: what it answers, and its errors."""

from __future__ import annotations

import json
import os
import subprocess
import sys
import time
import unittest
import uuid

import support
from vantrel import Client, DiscoveryFlags, ErrorCode, HoldFlags, VantrelError
from vantrel import protocol as p

SHARE = "com.example.notes.share"
PRINT = "com.example.notes.print"
MANAGER_ONLY = 'explaining for another host requires the "com.karvo.private.vantrel.manager" entitlement'


class RequestTest(support.DaemonTestCase):
    def setUp(self) -> None:
        self.client = Client(self.daemon.socket)
        self.addCleanup(self.client.close)

    def plugin_path(self, identifier: str) -> str:
        return os.path.join(self.notes, "PlugIns", identifier.rsplit(".", 1)[-1] + ".appex")

    def offered(self) -> dict:
        """identifier -> UUID of every plug-in match reports."""
        forms = self.client.match()[p.KEY_MATCHES]
        return {form["identifier"]: uuid.UUID(form["uuid"]) for form in forms}

    def test_discovery_and_status(self) -> None:
        self.assertEqual(set(self.offered()), {SHARE, PRINT})
        status = self.client.explain()[p.KEY_STATUS]
        self.assertEqual((status["version"], status[p.KEY_INSTALLED]), (p.CURRENT_VERSION, 2))
        [explanation] = self.client.explain(identifier=SHARE)[p.KEY_PLUGINS]
        self.assertEqual((explanation[p.KEY_OFFERED], explanation[p.KEY_REASON]), (True, "offered"))
        self.assertEqual(explanation["uuid"], self.offered()[SHARE])
        self.assertEqual(self.client.bulk(), {})
        with Client(self.daemon.socket, version=p.OLDEST_VERSION) as old:
            self.assertEqual(old.match(), {})

    def test_add_and_remove(self) -> None:
        app = support.write_app(os.path.join(self.daemon.root, "elsewhere"), "Extra",
                                ["com.example.extra.tool"])
        bundle = os.path.join(app, "PlugIns", "tool.appex")
        self.assertEqual(self.client.add([bundle]), {})
        self.assertIn("com.example.extra.tool", self.offered())
        self.assertEqual(self.client.remove([bundle]), {})
        self.assertNotIn("com.example.extra.tool", self.offered())
        self.assertEqual(self.client.explain(path=bundle)[p.KEY_REASON], "not-registered")

    def test_ready_and_access(self) -> None:
        uuids = self.offered()
        self.assertEqual(self.client.ready(uuids.values()), {})
        order = [PRINT, SHARE, PRINT]
        tokens = self.client.access([uuids[name] for name in order])[p.KEY_EXTENSIONS]
        # A read token ends with the bundle path it opens.
        self.assertEqual([token.rsplit(";", 1)[-1] for token in tokens],
                         [self.plugin_path(name) for name in order])

    def test_annotate_election(self) -> None:
        target = self.offered()[PRINT]
        self.addCleanup(self.client.annotate, [target], {p.ANNOTATION_ELECTION: 0})
        self.assertEqual(self.client.annotate([target], {p.ANNOTATION_ELECTION: 1}), {})
        elected = self.client.match({"QXUserElection": "1"})[p.KEY_MATCHES]
        self.assertEqual([form["identifier"] for form in elected], [PRINT])
        [explanation] = self.client.explain(uuid=target)[p.KEY_PLUGINS]
        self.assertEqual(explanation["election"], 1)

    def test_hold_and_release(self) -> None:
        token = self.client.hold([self.plugin_path(SHARE)])[p.KEY_UUIDS]
        self.assertIsInstance(token, uuid.UUID)
        self.assertNotIn(SHARE, self.offered())
        holds = self.client.explain()[p.KEY_STATUS][p.KEY_HOLDS]
        self.assertIn((token, os.getpid(), 1),
                      [(h[p.KEY_TOKEN], h["pid"], h["plugincount"]) for h in holds])
        self.assertEqual(self.client.release(token), {})
        self.assertIn(SHARE, self.offered())

    def test_hold_ends_with_its_connection(self) -> None:
        holder = Client(self.daemon.socket)
        holder.hold([self.notes], HoldFlags.APPLICATION)
        self.assertEqual(self.offered(), {})
        holder.close()
        deadline = time.monotonic() + 5
        while not self.offered() and time.monotonic() < deadline:
            time.sleep(0.05)
        self.assertEqual(set(self.offered()), {SHARE, PRINT})

    def test_error_replies(self) -> None:
        root = self.daemon.root
        os.makedirs(os.path.join(root, "empty"), exist_ok=True)
        unknown = uuid.uuid4()
        cases = [
            (lambda c: c.request(p.REQUEST_BULK, version=9),
             7, "unsupported protocol version 9 (current 3)"),
            (lambda c: c.request("frobnicate"), 4, "unrecognized request"),
            (lambda c: c.request(p.REQUEST_ADD, paths="/x"), 4, "invalid request format"),
            (lambda c: c.add(["rel/x"]), 9, "absolute path required: rel/x"),
            (lambda c: c.add(["/nonexistent/x"]), 9, "invalid plugin path: /nonexistent/x"),
            (lambda c: c.add([f"{root}/empty"]), 2, f"unable to register plug-in at {root}/empty"),
            (lambda c: c.remove(["/nonexistent/x"]), 9, "no plugin at /nonexistent/x"),
            (lambda c: c.ready([unknown]), 4, "no such plugin (uuid not found)"),
            (lambda c: c.request(p.REQUEST_ACCESS, uuids=["x"]),
             4, "invalid request (bad uuid array)"),
            (lambda c: c.annotate([], {p.ANNOTATION_ELECTION: "x"}),
             4, "invalid request format (annotation election)"),
            (lambda c: c.request(p.REQUEST_MATCH, rules=[1]),
             4, "invalid request format (bad rules dictionary)"),
            (lambda c: c.match(flags=DiscoveryFlags.ALL),
             11, "unauthorized discovery flag (VTDiscoverAll)"),
            (lambda c: c.hold([self.notes], HoldFlags.APPLICATION | HoldFlags.PLUGIN),
             4, "invalid request format (unsupported hold flags)"),
            (lambda c: c.hold(["/nonexistent"]), 9, "invalid path: /nonexistent"),
            (lambda c: c.hold([root]), 9, f"no plug-in at path:{root}"),
            (lambda c: c.explain(identifier=SHARE, uuid=unknown),
             4, "invalid request format (name one plug-in by uuid, path or identifier)"),
            (lambda c: c.explain(identifier=SHARE, pid=1), 11, MANAGER_ONLY),
        ]
        for call, code, text in cases:
            with self.subTest(text):
                with self.assertRaises(VantrelError) as raised:
                    call(self.client)
                self.assertEqual((raised.exception.code, raised.exception.text), (code, text))
                self.assertIsInstance(raised.exception.code, ErrorCode)

    def test_busy_while_a_plugin_runs(self) -> None:
        running = subprocess.Popen([os.path.join(self.plugin_path(SHARE), "plugin"), "30"])
        self.addCleanup(running.wait)
        self.addCleanup(running.kill)
        with self.assertRaises(VantrelError) as raised:
            self.client.hold([self.notes], HoldFlags.APPLICATION)
        self.assertEqual((raised.exception.code, raised.exception.text),
                         (ErrorCode.BUSY, "plug-ins are busy"))
        self.assertEqual(raised.exception.reply[p.KEY_CONFLICTS],
                         [{p.KEY_CONFLICT_BUNDLE_IDENTIFIER: SHARE}])
        self.assertEqual(set(self.offered()), {SHARE, PRINT})  # no hold was made

    @unittest.skipUnless(os.getuid() == 0, "needs root to connect as another user")
    def test_refused_to_another_user(self) -> None:
        script = (
            "import json, sys\n"
            f"sys.path.insert(0, {os.path.dirname(support.HERE)!r})\n"
            "from vantrel import Client, VantrelError\n"
            f"client = Client({self.daemon.socket!r})\n"
            "results = [len(client.match()['matches'])]\n"
            "for call in (lambda: client.add(['/x']), lambda: client.annotate([], {})):\n"
            "    try:\n"
            "        results.append(call())\n"
            "    except VantrelError as error:\n"
            "        results.append([int(error.code), error.text])\n"
            "print(json.dumps(results))\n")
        run = subprocess.run([sys.executable, "-c", script], user=65534, group=65534,
                             capture_output=True, text=True, timeout=20)
        self.assertEqual(run.returncode, 0, run.stderr)
        refusal = ('request "{}" refused: it changes what this daemon keeps for uid 0, '
                   'and uid 65534 is not that user, root or a manager')
        self.assertEqual(json.loads(run.stdout), [2, [11, refusal.format("add")],
                                                  [11, refusal.format("annotate")]])


if __name__ == "__main__":
    unittest.main()
