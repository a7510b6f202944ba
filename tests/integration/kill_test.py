"""Answered messages survive a kill or an end of the service at random moments under load."""

import contextlib
import os
import random
import signal
import statistics
import threading
import time

from harness import PATIENCE, SEND, Client, ServiceTest

NIGHTLY = bool(os.environ.get("QUARVEL_NIGHTLY"))
# Seconds after which an answered message must be safe from a kill: 10 ms, and more for a busy machine.
SAFE_AFTER = 0.010 + (0.040 if NIGHTLY else 1)
RESTART = 1 if NIGHTLY else 5


class Writer(threading.Thread):
    """Writes to a session of its own with `ahead` messages in flight, until the service is gone."""

    def __init__(self, service, round_number, reporter, ahead):
        super().__init__(daemon=True)
        self.key = f'{{"round":{round_number},"writer":{reporter},"n":'
        self.answered = []  # times of the answers, by message
        self._base = {"round": round_number, "writer": reporter}
        self._reporter, self._ahead = reporter, ahead
        self._client = Client(service)
        self._client.start_session(reporter)
        self.start()

    def run(self):
        waited_for, sent = set(), 0
        with contextlib.closing(self._client), contextlib.suppress(OSError):
            while True:
                while sent - len(self.answered) < self._ahead:
                    waited_for.add(self._client.send(SEND, {**self._base, "n": sent}, 3, 1, [self._reporter]))
                    sent += 1
                answer = self._client.receive()
                if answer is None:
                    return
                if answer in waited_for:
                    self.answered.append(time.monotonic())


class Kills(ServiceTest):
    def load(self, service, round_number):
        """A random choice of writers, with one message or many in flight."""
        return [Writer(service, round_number, reporter, ahead)
                for reporter, ahead in enumerate(random.choice(([1, 1, 1], [64], [1, 64], [32, 32, 32])), 1)]

    def stored(self, service, writer):
        """Counts the writer's stored messages, which must be its first ones, in order."""
        rows = service.rows("SELECT payload FROM message WHERE payload LIKE ? ORDER BY id", writer.key + "%")
        numbers = [int(row["payload"][len(writer.key):-1]) for row in rows]
        self.assertEqual(numbers, list(range(len(numbers))), "no gap between stored messages")
        return len(numbers)

    def test_answered_messages_survive_a_kill(self):
        service = self.service()
        kills, answered, lost, ages, restarts = (1000 if NIGHTLY else 100), 0, 0, [], []
        for number in range(kills):
            writers = self.load(service, number)
            time.sleep(random.uniform(0.02, 0.25))
            killed = time.monotonic()
            service.end(signal.SIGKILL)
            self.assertTrue(service.socket.exists(), "a killed service leaves its socket")
            for writer in writers:
                writer.join(PATIENCE)
            began = time.monotonic()
            service.start()
            restarts.append(time.monotonic() - began)
            missing = [writer.answered[self.stored(service, writer):] for writer in writers]
            answered += sum(len(writer.answered) for writer in writers)
            lost += sum(map(len, missing))
            ages.append(max([0] + [killed - answers[0] for answers in missing if answers]))
            self.assertLess(ages[-1], SAFE_AFTER, "answered, and lost")
        print(f"harness: kill: {kills} kills, {answered} messages answered, {lost} of them lost, answered at most "
              f"{max(ages) * 1000:.1f} ms before, {statistics.median(ages) * 1000:.1f} ms in half of the kills, more "
              f"than 10 ms in {sum(age > 0.01 for age in ages)}; back after "
              f"{statistics.median(restarts) * 1000:.0f} ms, at most {max(restarts) * 1000:.0f} ms", flush=True)
        self.assertGreater(answered, 10 * kills)
        self.assertLess(max(restarts), RESTART)

    def test_answered_messages_survive_an_orderly_end(self):
        service = self.service()
        ends, answered, longest = (200 if NIGHTLY else 20), 0, 0
        for number in range(ends):
            writers = self.load(service, number)
            time.sleep(random.uniform(0.02, 0.25))
            told = time.monotonic()
            self.assertEqual(service.end(), 0)
            longest = max(longest, time.monotonic() - told)
            for writer in writers:
                writer.join(PATIENCE)
                self.assertGreaterEqual(self.stored(service, writer), len(writer.answered))
                answered += len(writer.answered)
            service.start()
        print(f"harness: end: {ends} ends in order, {answered} messages answered, none lost, "
              f"{longest:.2f} s at most", flush=True)
        self.assertGreater(answered, 10 * ends)
        self.assertLess(longest, 5 if NIGHTLY else 20)
