# fish completion for kytdemo.
complete -c kytdemo -f
complete -c kytdemo -s h -l help -d 'Print help and exit'
complete -c kytdemo -l version -d 'Print the version and exit'
complete -c kytdemo -l programs -x -a '(__fish_complete_directories)' -d 'Folder of the programs'
complete -c kytdemo -l share -x -a '(__fish_complete_directories)' -d 'Folder of the shared files'
complete -c kytdemo -l folder -x -a '(__fish_complete_directories)' -d 'Lay out here and keep it'
complete -c kytdemo -l daemon-user -x -a '(__fish_complete_users)' -d 'Whom the daemon runs as'
complete -c kytdemo -l stage -d 'Run a program on the stage'
complete -c kytdemo -l client-user -x -a '(__fish_complete_users)' -d 'Whom its clients run as'
complete -c kytdemo -l once -d 'End after the checks'
