#pragma once

#include "status/StatusReport.hpp"

#include <chrono>

namespace qel::test {

/// A server with two consoles, a connection in its handshake, and two partitions. Every figure is different.
inline tool::StatusReport fakeReport()
{
    using namespace std::chrono_literals;
    using protocol::PartitionState;
    const std::chrono::system_clock::time_point start(1792000000s); // 2026-10-14T17:46:40Z
    tool::StatusReport report;
    report.version = "1.2.3";
    report.pid = 4711;
    report.now = tool::calendarTime(start + 3h + 25min + 7s);
    report.listen = {"127.0.0.1:4717", "[::1]:4717"};
    report.maxConsoles = 16;
    report.certificates = {{"own", "/etc/qel/server.crt", report.now + 220h, protocol::CertificateState::Due},
                           {"root", "/etc/qel/root.crt", report.now + 24000h, protocol::CertificateState::Fine}};

    protocol::ConnectedConsole alice;
    alice.peer.id = 7;
    alice.peer.commonName = "alice";
    alice.peer.fingerprint = "0C:7B";
    alice.peer.address = "192.0.2.7:40312";
    alice.peer.isProtected = true;
    alice.peer.toolType = 1;
    alice.peer.toolId = "ops-1";
    alice.isIdentified = true;
    alice.since = start + 3h;
    alice.received = {11, 1100};
    alice.queue.pending = {2, 2048};
    alice.queue.sent = {13, 13000};
    alice.queue.dropped = {3, 300};
    alice.queue.mostBytes = 4096;
    alice.queue.latency.increment(1ms, 12);
    alice.queue.latency.increment(2s, 1);
    protocol::ConnectedConsole plain = alice;
    plain.peer = protocol::Peer();
    plain.peer.id = 9;
    plain.peer.address = "127.0.0.1:5";
    plain.peer.toolId = "evil\x1b[2J";
    plain.since = start + 3h + 25min;
    protocol::ConnectedConsole knocking;
    knocking.peer.address = "192.0.2.9:1";
    knocking.since = start + 3h + 25min + 5s;
    report.server.since = start;
    report.server.consoles = {alice, plain, knocking};
    report.server.accepted = 21;
    report.server.refused = {0, 1, 0, 2, 0, 3, 0, 0, 0, 4};
    report.server.received = {22, 2200};
    report.server.queues = alice.queue;

    PartitionState web{};
    web.id = 1;
    web.name = "web1";
    web.description = "rack 4";
    web.line = PartitionState::Line::Up;
    web.sessions = {{0, 7, true}, {3, 9, true}, {15, 8, false}};
    web.outputMessages = 31;
    web.outputBytes = 1572864;
    web.inputMessages = 32;
    web.inputBytes = 33;
    web.starts = 2;
    web.skippedBytes = 34;
    web.droppedBytes = 35;
    web.keptBytes = 36;
    web.waitingBytes = 37;
    web.replayBytes = 65536;
    PartitionState other{};
    other.id = 300;
    other.line = PartitionState::Line::ComingUp;
    report.partitions = {web, other};
    return report;
}

} // namespace qel::test
