#!/usr/bin/perl
# The syslog of the sandbox (sandbox.sh): receives what programs send to
# the socket PATH (the namespace's /dev/log) and writes one line a message
# to standard output, with its severity in words, until process PID ends.
#
#   sandbox-syslog.pl PATH PID
#
# A message as glibc's syslog() sends it, with no line end:
#   <27>Nov 21 06:26:01 zark-webapid[123]: module ... rejected: no GetAPITable
# is written as
#   err: Nov 21 06:26:01 zark-webapid[123]: module ... rejected: no GetAPITable
use strict;
use warnings;
use IO::Select;
use IO::Socket::UNIX;
use Socket qw(SOCK_DGRAM);

my ($path, $watched) = @ARGV;
die "usage: sandbox-syslog.pl PATH PID\n" unless defined $watched;

unlink $path;
my $socket = IO::Socket::UNIX->new(Type => SOCK_DGRAM, Local => $path)
  or die "sandbox-syslog: $path: $!\n";
chmod 0666, $path;
$| = 1;

my @severity = qw(emerg alert crit err warning notice info debug);
my $select = IO::Select->new($socket);
# Looks at the watched process once a second at least.
while (kill 0, $watched) {
  next unless $select->can_read(1);
  my $message;
  next unless defined $socket->recv($message, 65536);
  $message =~ s/[\0\n]+$//;
  my $priority = $message =~ s/^<(\d{1,3})>// ? $1 : 13;
  print "$severity[$priority & 7]: $message\n";
}
