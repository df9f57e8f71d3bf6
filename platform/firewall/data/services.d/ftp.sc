# FTP file service: the control port and the passive data port range.
[ftp]
title="FTP"
protocol=tcp
ports=21
forwardable=yes

[ftp_passive]
title="FTP passive data ports"
protocol=tcp
ports=55536-55899
forwardable=yes
