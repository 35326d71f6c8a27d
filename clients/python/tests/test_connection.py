"""One connection under load, and a daemon that stops answering or goes away."""

from __future__ import annotations

import asyncio
import os
import signal
import threading
import time
import unittest

import support
from vantrel import AsyncClient, Client, VantrelConnectionError, VantrelError
from vantrel import protocol as p

# Well below the clients' default timeout of 10 s: a failure must come from
# the connection ending, not from a timeout.
PROMPTLY = 3.0


class PipelineTest(support.DaemonTestCase):
    def test_many_requests_in_flight_get_their_own_replies(self) -> None:
        # Three kinds of request, each reply telling which request it answers.
        def call(client: AsyncClient, i: int):
            if i % 3 == 0:
                return client.explain()
            if i % 3 == 1:
                return client.request(p.REQUEST_BULK, version=100 + i)
            return client.explain(identifier=f"com.example.none{i}")

        def expected(i: int) -> str:
            if i % 3 == 0:
                return "installed 2"
            if i % 3 == 1:
                return f"unsupported protocol version {100 + i} (current 3)"
            return f"no plug-in com.example.none{i} is installed"

        def seen(result: object) -> str:
            if isinstance(result, VantrelError):
                return result.text
            if isinstance(result, dict) and p.KEY_STATUS in result:
                return f"installed {result[p.KEY_STATUS][p.KEY_INSTALLED]}"
            return result[p.KEY_TEXT] if isinstance(result, dict) else repr(result)

        async def run() -> list:
            async with await AsyncClient.connect(self.daemon.socket) as client:
                tasks = [asyncio.ensure_future(call(client, i)) for i in range(90)]
                await asyncio.sleep(0)
                self.assertGreater(client.in_flight, 1)
                results = await asyncio.gather(*tasks, return_exceptions=True)
                self.assertEqual(client.in_flight, 0)
                return results

        results = asyncio.run(run())
        self.assertEqual([seen(r) for r in results], [expected(i) for i in range(90)])


class DaemonGoneTest(unittest.TestCase):
    def setUp(self) -> None:
        self.daemon = support.Daemon()
        self.addCleanup(self.daemon.remove)
        self.daemon.start()

    def kill_soon(self) -> None:
        """Freezes the daemon so that requests stay unanswered, and kills it
        a moment later."""
        self.daemon.pause()
        threading.Timer(0.3, self.daemon.signal, [signal.SIGKILL]).start()

    def test_sync_call_fails_when_the_daemon_dies(self) -> None:
        with Client(self.daemon.socket) as client:
            self.kill_soon()
            started = time.monotonic()
            with self.assertRaises(VantrelConnectionError) as raised:
                client.bulk()
            self.assertLess(time.monotonic() - started, PROMPTLY)
            self.assertEqual(raised.exception.path, self.daemon.socket)
            with self.assertRaises(VantrelConnectionError):
                client.explain()

    def test_async_calls_fail_when_the_daemon_dies(self) -> None:
        async def run() -> None:
            client = await AsyncClient.connect(self.daemon.socket)
            self.kill_soon()
            started = time.monotonic()
            results = await asyncio.gather(*[client.bulk() for _ in range(5)],
                                           return_exceptions=True)
            self.assertLess(time.monotonic() - started, PROMPTLY)
            self.assertTrue(all(isinstance(r, VantrelConnectionError) for r in results), results)
            with self.assertRaises(VantrelConnectionError):
                await client.explain()
            await client.close()

        asyncio.run(run())

    def test_timeout_leaves_the_connection_usable(self) -> None:
        # The late reply to the timed-out "bulk" ({}) must not be taken for
        # the reply to the next request.
        def sync() -> dict:
            with Client(self.daemon.socket) as client:
                self.daemon.pause()
                with self.assertRaises(TimeoutError):
                    client.bulk(timeout=0.2)
                self.daemon.resume()
                return client.explain()

        async def asynchronous() -> dict:
            async with await AsyncClient.connect(self.daemon.socket) as client:
                self.daemon.pause()
                with self.assertRaises(TimeoutError):
                    await client.bulk(timeout=0.2)
                self.daemon.resume()
                return await client.explain()

        for name, run in [("sync", sync), ("async", lambda: asyncio.run(asynchronous()))]:
            with self.subTest(name):
                self.assertIn(p.KEY_STATUS, run())

    def test_no_daemon(self) -> None:
        path = os.path.join(self.daemon.root, "nobody-listens")
        with self.assertRaises(VantrelConnectionError) as raised:
            Client(path)
        self.assertEqual(raised.exception.path, path)
        with self.assertRaises(VantrelConnectionError):
            asyncio.run(AsyncClient.connect(path))


if __name__ == "__main__":
    unittest.main()
