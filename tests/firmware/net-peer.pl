#!/usr/bin/perl
# The peer of the firmware socket test (run-net-test.sh): listeners on this
# machine's loopback only, each with one behaviour, served from one process.
#
#   net-peer.pl PORT_FILE LIFETIME_SECONDS
#
# Writes "echo=N closed=N reset=N silent=N finish=N echo6=N" to PORT_FILE
# once listening (echo6 is 0 when ::1 is unavailable), then serves until
# LIFETIME_SECONDS have passed:
#   echo    returns every byte it receives (buffered without limit, so a
#           client that sends everything before reading cannot deadlock it)
#   closed  a port that was free a moment ago, with no listener
#   reset   accepts and resets the connection RESET_DELAY seconds later
#           (SO_LINGER 0); at once, the reset could overtake the handshake
#           that QEMU completes for the guest, turning it into a refusal
#   silent  accepts and never sends or closes
#   finish  sends FINISH_BYTES of the test pattern and closes in order
#   echo6   as echo, on ::1
use strict;
use warnings;
use IO::Select;
use IO::Socket::IP;
use Socket qw(SOL_SOCKET SO_LINGER);
use Errno qw(EAGAIN EWOULDBLOCK EINTR);
use Time::HiRes qw(time);

use constant FINISH_BYTES => 3000;
use constant RESET_DELAY => 0.2;

my ($port_file, $lifetime) = @ARGV;
die "usage: $0 PORT_FILE LIFETIME_SECONDS\n" unless defined $lifetime;

sub listener {
  my ($host) = @_;
  return IO::Socket::IP->new(LocalHost => $host, LocalPort => 0, Listen => 16,
                             ReuseAddr => 1, Proto => 'tcp');
}

# The first COUNT bytes of the test pattern: byte I is (I * 7 + I / 251 + 3)
# mod 256, as the firmware test computes it, which repeats every 256 * 251
# bytes.
sub pattern {
  my ($count) = @_;
  my $period = 256 * 251;
  my $one = join '', map { chr(($_ * 7 + int($_ / 251) + 3) & 0xFF) } 0 .. $period - 1;
  return substr($one x (int($count / $period) + 1), 0, $count);
}

my %role_of;    # listener fileno -> role
my %listener;   # role -> socket
for my $role (qw(echo reset silent finish)) {
  my $socket = listener('127.0.0.1') or die "listen on 127.0.0.1: $!\n";
  $listener{$role} = $socket;
  $role_of{fileno $socket} = $role;
}
my $v6 = listener('::1');
if ($v6) {
  $listener{echo6} = $v6;
  $role_of{fileno $v6} = 'echo6';
}
my $closed = listener('127.0.0.1') or die "listen: $!\n";
my $closed_port = $closed->sockport;
close $closed;

open my $out, '>', "$port_file.tmp" or die "$port_file: $!\n";
printf $out "echo=%d closed=%d reset=%d silent=%d finish=%d echo6=%d\n",
  $listener{echo}->sockport, $closed_port, $listener{reset}->sockport,
  $listener{silent}->sockport, $listener{finish}->sockport, $v6 ? $v6->sockport : 0;
close $out;
rename "$port_file.tmp", $port_file or die "$port_file: $!\n";

my $readers = IO::Select->new(values %listener);
my %pending;    # echo connection fileno -> bytes still to send back
my %echo;       # fileno -> socket
my @silent;     # kept open, never served
my @resets;     # [socket, when] to be reset
my $deadline = time + $lifetime;

sub drop {
  my ($socket) = @_;
  my $fd = fileno $socket;
  $readers->remove($socket);
  delete $pending{$fd};
  delete $echo{$fd};
  close $socket;
}

while (time < $deadline) {
  my $writers = IO::Select->new(map { $echo{$_} } grep { length $pending{$_} } keys %pending);
  my $wait = 0.5;
  for my $due (@resets) {
    my $left = $due->[1] - time;
    $wait = $left if $left < $wait;
  }
  $wait = 0 if $wait < 0;
  my ($can_read, $can_write) = IO::Select->select($readers, $writers, undef, $wait);
  my @later;
  for my $due (@resets) {
    if ($due->[1] <= time) {
      setsockopt($due->[0], SOL_SOCKET, SO_LINGER, pack('ii', 1, 0));
      close $due->[0];
    } else {
      push @later, $due;
    }
  }
  @resets = @later;
  for my $socket (@{ $can_read || [] }) {
    my $role = $role_of{ fileno $socket };
    if (defined $role && $listener{$role} == $socket) {
      my $client = $socket->accept or next;
      if ($role eq 'echo' || $role eq 'echo6') {
        $client->blocking(0);
        $echo{ fileno $client } = $client;
        $pending{ fileno $client } = '';
        $readers->add($client);
      } elsif ($role eq 'reset') {
        push @resets, [$client, time + RESET_DELAY];
      } elsif ($role eq 'silent') {
        push @silent, $client;
      } elsif ($role eq 'finish') {
        my $data = pattern(FINISH_BYTES);
        while (length $data) {
          my $n = syswrite $client, $data;
          last unless defined $n;
          substr($data, 0, $n) = '';
        }
        shutdown $client, 1;
        close $client;
      }
      next;
    }
    my $n = sysread $socket, my $chunk, 65536;
    if (!defined $n) {
      drop($socket) unless $! == EAGAIN || $! == EWOULDBLOCK || $! == EINTR;
    } elsif ($n == 0) {
      drop($socket);
    } else {
      $pending{ fileno $socket } .= $chunk;
    }
  }
  for my $socket (@{ $can_write || [] }) {
    my $fd = fileno $socket;
    next unless defined $fd && defined $pending{$fd};
    my $n = syswrite $socket, $pending{$fd};
    if (defined $n) {
      substr($pending{$fd}, 0, $n) = '';
    } elsif (!($! == EAGAIN || $! == EWOULDBLOCK || $! == EINTR)) {
      drop($socket);
    }
  }
}
