# Network backup with rsync.
[rsync]
title="rsync"
protocol=tcp
ports=873
forwardable=yes
