#!/usr/bin/env python3
"""Round trips of single OPTIONS requests, one at a time, timed with the monotonic clock (sipp's
own timer has only millisecond resolution). Prints the median in microseconds and the losses.

usage: rtt.py TARGET_HOST:PORT LOCAL_ADDRESS LOCAL_PORT COUNT
"""
import os
import socket
import statistics
import sys
import time

host, port = sys.argv[1].rsplit(":", 1)
local, local_port, count = sys.argv[2], int(sys.argv[3]), int(sys.argv[4])
s = socket.socket(socket.AF_INET, socket.SOCK_DGRAM)
s.bind((local, local_port))
s.settimeout(1.0)
times, lost = [], 0
for i in range(count):
    call = f"rtt-{os.getpid()}-{i}@bench"  # the answerer remembers ended calls
    request = (f"OPTIONS sip:bench@{host}:{port} SIP/2.0\r\n"
               f"Via: SIP/2.0/UDP {local}:{local_port};branch=z9hG4bK-rtt-{i}\r\n"
               f"From: <sip:rtt@{local}>;tag={i}\r\nTo: <sip:bench@{host}>\r\n"
               f"Call-ID: {call}\r\nCSeq: 1 OPTIONS\r\nMax-Forwards: 70\r\n"
               "Content-Length: 0\r\n\r\n").encode()
    start = time.perf_counter_ns()
    s.sendto(request, (host, int(port)))
    try:
        while True:
            answer = s.recv(65536)
            if call.encode() in answer:
                break
        times.append((time.perf_counter_ns() - start) / 1000)
    except socket.timeout:
        lost += 1
print(f"{statistics.median(times):.0f} {lost}" if times else f"- {lost}")
